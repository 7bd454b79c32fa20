#pragma once

#include <cstddef>
#include <cstdint>
#include <dirent.h>
#include <memory>
#include <optional>
#include <string>
#include <sys/stat.h>
#include <sys/types.h>

#include "platform/linux/files/owned_descriptor.h"
#include "property_lists/bytes.h"

// What the Linux counterparts share for reaching files. Failures leave their reason in `errno`.
namespace kel::platform {

/// The text of an error number, independent of the locale.
std::string errorText(int errorNumber);

/// "PATH: TEXT", one line for one failed operation.
std::string errorLine(const std::string& path, int errorNumber);

/// True for an error that may pass by itself (an input error, no descriptor or memory left, a stale handle),
/// false for one that answers: nothing there, no directory, not permitted, not what is read here.
bool isTransient(int errorNumber);

/// False, with EINVAL, for a path that holds a NUL: the kernel would see a shorter one.
bool isWhole(const std::string& path);

/// `openat` of a path relative to `directory` (AT_FDCWD for the working directory), closed on exec. Fails
/// when it is not whole.
OwnedDescriptor openFile(int directory, const std::string& path, int flags, mode_t mode = 0);

/// Writes all of `bytes`, however often the kernel takes only a part.
bool writeWhole(int descriptor, BytesView bytes);

/// The contents of a regular file, whole; also of a file in /proc or /sys, whose status says 0 bytes. Never
/// waits for a FIFO or a device: what is no regular file fails with EINVAL, a directory with EISDIR, and a
/// file of more than `largest` bytes with EFBIG.
std::optional<Bytes> readFile(int directory, const std::string& path, std::size_t largest);

/// The same as text, for the small files of the system.
std::optional<std::string> readSmallFile(int directory, const std::string& path, std::size_t largest = 65536);

/// True when `descriptor` is that of a regular file; `status` is then what the kernel tells about it
/// (`fstat`). Else fails as `readFile`.
bool isRegularFile(int descriptor, struct stat& status);

struct CloseDirectory {
  void operator()(DIR* directory) const { closedir(directory); }
};

/// The entries of a directory, to be had with `readdir`; null when it cannot be read.
using DirectoryListing = std::unique_ptr<DIR, CloseDirectory>;

/// Lists `path`; fails when it is not whole.
DirectoryListing openListing(const std::string& path);

/// Makes `path` and its missing parents, mode 0700.
bool makeDirectories(const std::string& path);

/// True when `path` leads to a directory; a symbolic link is followed.
bool isDirectory(const std::string& path);

/// A random number from the kernel. Where the kernel refuses one, the clock and the process stand in: callers
/// want numbers that differ, not secrets.
std::uint64_t randomNumber();

}  // namespace kel::platform
