#pragma once

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/linux/journal/entry_record.h"
#include "platform/linux/journal/journal_tree.h"

namespace kel::platform {

/// A file system: whether its identity is known, whether it tells of every change.
struct FileSystemTraits {
  std::uint64_t identity = 0;
  bool notifies = false;
};

/// What a look at a node found, compared with what is remembered. Nothing but these differences needs to be
/// installed.
struct DirectoryLook {
  JournalNode* node = nullptr;

  bool isLate = false;  ///< there was no time left for it: nothing else is set

  // Of an entry that is no directory, or a link, and was looked at itself.
  bool hasRecord = false;
  EntryRecord record;

  // Of a directory, or of what a link leads to.
  bool isListing = false;
  int watch = -1;
  int watchError = 0;
  int error = 0;
  EntryStatus own;
  bool ownIsRacy = false;
  std::uint64_t device = 0;
  FileSystemTraits fileSystem;
  std::vector<std::pair<JournalNode*, EntryRecord>> recorded;  ///< known entries with another record
  std::vector<std::pair<std::string, EntryRecord>> added;
  std::vector<JournalNode*> gone;
  std::vector<JournalNode*> suspected;  ///< subdirectories that may have been exchanged
};

/// How to look.
struct LookSettings {
  int inotify = -1;  ///< -1: without a watch
  std::uint32_t watchMask = 0;
  std::atomic<std::int64_t>* watchesLeft = nullptr;  ///< for directories that have none yet; with `inotify`
  bool alwaysDigest = false;                         ///< also where changes are told by watches
  std::size_t mostEntries = 0;
  std::chrono::steady_clock::time_point deadline = std::chrono::steady_clock::time_point::max();
};

/// Looks at the node at `path`: lists a directory, watching it first, and takes the records of its entries
/// other than directories, which are looked at on their own. A directory that cannot have changed is not
/// listed. Changes nothing; looks at different nodes may run in parallel.
DirectoryLook lookAt(JournalNode& node, const std::string& path, const LookSettings& settings);

}  // namespace kel::platform
