#pragma once

#include <cstdint>
#include <mutex>
#include <string>
#include <unordered_map>

#include "platform/linux/journal/entry_record.h"

// Looking at what is on the disk. Any thread.
namespace kel::platform {

/// What one look at a path tells.
struct EntryLook {
  EntryStatus status;        ///< links followed
  EntryStatus link;          ///< the link's own, when the path ends in one; else of unknown kind
  std::uint64_t device = 0;  ///< of what `status` tells
  std::uint64_t mount = 0;
  std::string attributes;  ///< mode and owners, as text

  bool isLink() const { return link.kind != EntryKind::Unknown; }
};

/// Looks at `path`: one system call, and a second for a link.
EntryLook lookAtEntry(const std::string& path);

/// The time that local file systems stamp changes with, in nanoseconds.
std::int64_t timeStampNow();

/// What is known of a file system.
struct FileSystemTraits {
  std::uint64_t identity = 0;  ///< as far as it has one
  bool notifies = false;       ///< whatever is changed is changed through this kernel, and told
};

/// The file systems that were met, by device, so that each is asked once. Any thread.
class FileSystems {
 public:
  /// Those of the file system that holds `path` and had the number `device` a moment ago.
  FileSystemTraits traits(std::uint64_t device, const std::string& path);

  /// After a mount the numbers may be those of others.
  void forget();

 private:
  std::mutex mutex_;
  std::unordered_map<std::uint64_t, FileSystemTraits> known_;
};

}  // namespace kel::platform
