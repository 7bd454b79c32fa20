#pragma once

#include <cstdint>
#include <optional>

#include "property_lists/digest.h"

namespace kel::platform {

class ByteReader;
class ByteWriter;

enum class EntryKind : std::uint8_t { Unknown, File, Directory, Link, Other };

/// The status of a directory entry: what the kernel tells about it without opening it, as far as that helps
/// to see later whether the entry is still the same. Times are nanoseconds since the epoch and are only ever
/// compared for equality: clocks are set back. Of an unknown entry `size` is the error number that says why.
struct EntryStatus {
  EntryKind kind = EntryKind::Unknown;
  std::uint64_t inode = 0;
  std::int64_t changed = 0;
  std::int64_t modified = 0;
  std::uint64_t size = 0;

  bool operator==(const EntryStatus&) const = default;
};

/// What is remembered of an entry, to find out later whether it changed.
struct EntryRecord {
  EntryStatus status;            ///< links followed
  EntryStatus link;              ///< the link's own, when the entry is one; else of unknown kind
  std::uint64_t fileSystem = 0;  ///< identity of the file system of what `status` tells, as far as it has one
  std::uint64_t mount = 0;       ///< the mount through which that was reached
  bool isKnown = false;          ///< false: nothing can be told from this record
  bool isRacy = false;  ///< taken so soon after a change that the next one may leave the status alike
  std::optional<Digest> digest;  ///< of a racy entry: attributes, link text and contents, when readable

  bool isDirectory() const { return status.kind == EntryKind::Directory; }
  bool isLink() const { return link.kind != EntryKind::Unknown; }
};

/// How far the times of a file system can be trusted.
enum class TimeStamps : std::uint8_t {
  Local,   ///< from this machine's clock
  Foreign  ///< from another machine's, which may go differently
};

/// True when an entry last changed at `changed` might change again, or might have, without another stamp: it
/// was looked at, not before `now`, within the granularity of its file system's clock.
bool isRacy(std::int64_t changed, std::int64_t now, TimeStamps stamps);

/// True when both are of the same file, directory or absence, reached in the same way.
bool isSameEntry(const EntryRecord& before, const EntryRecord& now);

/// True when everything but the contents is alike.
bool isAlike(const EntryRecord& before, const EntryRecord& now);

/// True when nothing can have changed between the two records.
bool isUnchanged(const EntryRecord& before, const EntryRecord& now);

/// How a status lies in files. What is no status fails the reader.
void writeStatus(ByteWriter& writer, const EntryStatus& status);
EntryStatus readStatus(ByteReader& reader);

}  // namespace kel::platform
