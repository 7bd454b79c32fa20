#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <time.h>

#include "platform/bytes.h"

namespace kel::platform {

/// Tells one state of a file from another, also after a restart, which may number devices anew. Compared for
/// equality only: times go back with the clock.
struct FileIdentity {
  std::uint64_t inode = 0;
  std::uint64_t changeTime = 0;        ///< nanoseconds
  std::uint64_t modificationTime = 0;  ///< nanoseconds
  std::uint64_t size = 0;

  bool operator==(const FileIdentity&) const = default;
};

/// What can be told about an application's information dictionary without opening it. Links are followed.
struct InformationStatus {
  std::optional<FileIdentity> identity;  ///< absent when there is no such file, or when it cannot be told
  bool isKnown = false;                  ///< it can be told
  bool isLink = false;                   ///< the dictionary lies somewhere else
  bool isReadable = false;               ///< a regular file that is not too large
  timespec changeTime{};
};
InformationStatus informationStatus(const std::string& application);

/// True when a file could change at `now`, or later, and keep the change time that it has: file systems stamp
/// with the ticks of a clock, and some with far coarser ones.
bool isRacy(const timespec& changeTime, const timespec& now);

/// The information flags that a dictionary of these contents sets; none when it is malformed.
std::uint32_t informationFlags(BytesView contents);

/// Where an application's information dictionary is.
std::string informationPath(const std::string& application);

}  // namespace kel::platform
