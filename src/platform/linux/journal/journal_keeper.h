#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "platform/event_journal.h"
#include "platform/file_system.h"
#include "platform/linux/journal/entry_look.h"
#include "platform/linux/journal/journal_forest.h"

namespace kel::platform {

/// What the journal is made with.
struct JournalOptions {
  std::vector<std::string> applicationDirectories;  ///< watched beside those of the services
  std::optional<std::string> directory;             ///< for the index; absent: nothing outlasts the process
  JournalForest::Limits limits;
  std::chrono::milliseconds longestLook{5'000};      ///< per question; after that it cannot be told
  std::function<std::int64_t()> now = timeStampNow;  ///< what positions follow, nanoseconds
};

/// Positions, questions and the index file. Used by one thread at a time. Borrows `files`, `log`, `pool`.
class JournalKeeper {
 public:
  JournalKeeper(std::vector<WatchedRoot> roots, const JournalOptions& options, FileSystem& files,
                SystemLog& log, ConcurrentQueue& pool);

  /// Reads the index file. Once, before anything else.
  void open();

  JournalForest& forest() { return forest_; }

  /// The position of now: what happened so far, as far as it can be found in time, is not later than it.
  EventID currentEventID();

  EventID lastID() const { return lastID_; }

  /// The events under the paths after `since`, without history done. Where they cannot be told there is one
  /// that says so instead. `watchesRoot`: a root that was itself exchanged is told as such.
  std::vector<JournalEvent> eventsSince(EventID since, const std::vector<std::string>& paths,
                                        bool watchesRoot);

  /// Looks at some of what is queued, for some milliseconds, a second at most; true when it makes sense to go
  /// on.
  bool lookInBackground();

  /// Queues what is uncovered to be looked at in the background.
  void questionUncovered() { forest_.questionUncovered(allTrees()); }

  /// True when the index file lags behind.
  bool needsSaving() const { return latestEvent() != savedEvent_; }

  /// What is to be written to `indexPath`. Afterwards nothing needs saving.
  Bytes indexFile();
  const std::string& indexPath() const { return indexPath_; }
  bool keepsIndex() const { return !indexPath_.empty(); }

 private:
  EventID newID();
  void reserve(EventID id);
  void settle(const std::vector<JournalTree*>& trees);
  void noteHorizons();
  std::vector<JournalTree*> allTrees() const;
  JournalTree* treeOf(const std::string& path) const;
  EventID latestEvent() const;

  const JournalOptions options_;
  const std::vector<WatchedRoot> roots_;
  FileSystem& files_;
  SystemLog& log_;
  std::string indexPath_;
  std::string positionPath_;
  EventID lastID_ = 0;
  EventID reservedID_ = 0;  ///< a later process starts behind it
  EventID savedEvent_ = 0;
  EventID lastTold_ = 0;  ///< the newest event when the position file was written
  bool failureReported_ = false;
  std::optional<std::chrono::steady_clock::time_point> lastLate_;  // when time last ran out
  JournalForest forest_;
};

}  // namespace kel::platform
