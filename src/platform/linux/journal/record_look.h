#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <string>
#include <vector>

#include "platform/linux/journal/entry_look.h"
#include "platform/linux/journal/journal_tree.h"

namespace kel::platform {

/// What a look may use.
struct LookSettings {
  FileSystems& fileSystems;
  int inotify = -1;                        ///< -1: nothing is watched
  std::atomic<std::int64_t>& watchesLeft;  ///< how many further watches may be had
  std::chrono::steady_clock::time_point deadline;
};

/// What a look at one record's place on the disk found.
struct RecordLook {
  bool isTaken = false;  ///< false: there was no time
  EntryRecord record;
  bool differs = false;  ///< something may have changed since the last record was taken
  int watch = -1;
  int watchError = 0;  ///< why there is no watch, where one would help
  bool tells = false;
  bool isListed = false;
  int listingError = 0;
  std::vector<ListedName> names;  ///< sorted
  std::string chain;              ///< of a root
};

/// Looks at what `path`, the node's, leads to. Any thread, as long as nobody changes the tree. Never waits
/// for a FIFO or a device and reads at most 1 MiB, and nothing after the deadline.
RecordLook lookAt(const JournalNode& node, const std::string& path, const LookSettings& settings);

}  // namespace kel::platform
