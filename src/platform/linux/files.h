#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <sys/types.h>

#include "platform/bytes.h"
#include "platform/linux/owned_descriptor.h"

// What the Linux counterparts share for reaching files. Failures leave their reason in `errno`.
namespace kel::platform {

/// The text of an error number, independent of the locale.
std::string errorText(int errorNumber);

/// "PATH: TEXT", one line for one failed operation.
std::string errorLine(const std::string& path, int errorNumber);

/// `openat` of a path relative to `directory` (AT_FDCWD for the working directory), closed on exec. A path
/// that holds a NUL fails with EINVAL: the kernel would see a shorter one.
OwnedDescriptor openFile(int directory, const std::string& path, int flags, mode_t mode = 0);

/// Writes all of `bytes`, however often the kernel takes only a part.
bool writeWhole(int descriptor, BytesView bytes);

/// The whole text of a small file of the system, also of one that states no size; a longer one than `largest`
/// fails with EFBIG, what is no regular file with EINVAL.
std::optional<std::string> readSmallFile(int directory, const std::string& path, std::size_t largest = 65536);

/// Makes `path` and its missing parents, mode 0700.
bool makeDirectories(const std::string& path);

/// True when `path` leads to a directory; a symbolic link is followed.
bool isDirectory(const std::string& path);

/// A random number from the kernel. Where the kernel refuses one, the clock and the process stand in: callers
/// want numbers that differ, not secrets.
std::uint64_t randomNumber();

}  // namespace kel::platform
