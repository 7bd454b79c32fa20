#pragma once

#include <chrono>
#include <cstdint>

#include "platform/linux/journal/entry_record.h"

// Taking records of what is on the disk.
namespace kel::platform {

/// Looks at `name` in `directory`: at a link and at what it leads to. Of a directory only kind and inode.
EntryRecord lookAtEntry(int directory, const char* name);

/// The time that local file systems stamp changes with, in nanoseconds.
std::int64_t timeStampNow();

/// How to take a record.
struct RecordTaking {
  std::int64_t now = 0;  ///< `timeStampNow`, from before the look
  TimeStamps stamps = TimeStamps::Local;
  bool digestIfRacy = true;  ///< also of what a watch tells the changes of
  std::chrono::steady_clock::time_point deadline = std::chrono::steady_clock::time_point::max();
};

/// Looks at `name` in `directory`, at a link and at what it leads to. `before` is the last record, absent for
/// a new entry: one with a digest gets a digest again, so that the two can be compared. Never waits for a
/// FIFO or a device and reads at most 1 MiB, and nothing after the deadline.
EntryRecord takeRecord(int directory, const char* name, const EntryRecord* before,
                       const RecordTaking& taking);

/// The status of an open file or directory; of unknown kind when it cannot be had. `device` is set with it.
EntryStatus statusOf(int descriptor, std::uint64_t& device);

}  // namespace kel::platform
