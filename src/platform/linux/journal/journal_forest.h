#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <unordered_map>
#include <unordered_set>
#include <utility>
#include <vector>

#include "platform/linux/files/owned_descriptor.h"
#include "platform/linux/journal/journal_tree.h"
#include "platform/linux/journal/record_look.h"
#include "platform/system_log.h"
#include "platform/work_queue.h"

namespace kel::platform {

/// Keeps the trees of the watched roots in step with the disk: by looking at what is doubted, and by the
/// kernel's events for what is watched (see journal_tree.h for the states of a record).
///
/// Used by one thread at a time; only the looks of one batch run in parallel. Borrows `log` and `pool`.
class JournalForest {
 public:
  struct Limits {
    std::function<bool()> mayWatch;     ///< false: no inotify instance is to be had now; unset: it may
    std::size_t mostWatches = 100'000;  ///< further records are uncovered
    std::size_t mostRecords = 200'000;  ///< of one root; beyond that nothing is told of it
    std::size_t mostGone = 20'000;      ///< records that are kept though their names are gone
    std::string home;  ///< only here and below is a directory watched for the name of a root that is missing
  };

  /// What something happened to, whether it can be told precisely or not.
  struct Hints {
    bool services = false;
    bool applications = false;
  };

  /// Without the watches above the roots.
  struct Size {
    std::size_t records = 0;
    std::size_t watches = 0;
  };

  /// `newID` gives the ID of the next event.
  JournalForest(std::vector<WatchedRoot> roots, Limits limits, std::function<EventID()> newID, SystemLog& log,
                ConcurrentQueue& pool);
  JournalForest(const JournalForest&) = delete;
  JournalForest& operator=(const JournalForest&) = delete;

  /// Takes over what an index file held. Once, before anything else.
  void restore(std::vector<std::unique_ptr<JournalTree>> trees);

  const std::vector<std::unique_ptr<JournalTree>>& trees() const { return trees_; }

  /// As they were given.
  const std::vector<WatchedRoot>& roots() const { return roots_; }

  /// True when something is still to be looked at.
  bool hasDoubts() const { return !doubted_.empty(); }

  /// Null when no tree covers the path.
  JournalTree* treeOf(std::string_view path) const;

  /// Tries to have an inotify instance; true when there is a new one.
  bool openEvents();

  /// The descriptor that becomes readable when there are events; -1 while there is none.
  int eventDescriptor() const { return inotify_.get(); }

  /// Notes the events so far.
  void readEvents();

  /// Doubts what no event tells of: what is uncovered, and where the roots' paths lead.
  void doubtUncovered();

  /// Everything may be another, and so may the numbers of the file systems.
  void doubtEverything();

  enum class LookMode {
    InBackground,  ///< on this thread alone, for some milliseconds
    InParallel
  };

  /// Looks at some of what is doubted; true when there is more and time to go on.
  bool lookAtSome(LookMode mode, std::chrono::steady_clock::time_point deadline);

  /// The newest event, or beginning of a tree.
  EventID latestEvent() const;

  Size size() const;

  /// What happened since the last call.
  Hints takeHints() { return std::exchange(hints_, {}); }

 private:
  // Events.
  void applyEvent(JournalNode& node, std::uint32_t mask, std::string_view name, EventID id);
  void noteName(JournalNode& folder, std::string_view name, bool isDirectory, EventID id);
  void noteOverflow(EventID id);
  void noteLostWatch(int watch);
  void noteApproach(int watch, std::uint32_t mask, std::string_view name, EventID id);
  void watchApproach(JournalTree& tree);

  // Looks.
  std::vector<JournalNode*> nextBatch() const;
  std::vector<RecordLook> takeLooks(const std::vector<JournalNode*>& nodes, LookMode mode,
                                    std::chrono::steady_clock::time_point deadline);
  void install(JournalNode& node, RecordLook& look, EventID id);
  void installRoot(JournalNode& root, RecordLook& look);
  void installNames(JournalNode& folder, const RecordLook& look, EventID id);
  void settle(JournalNode& node, const RecordLook& look);
  void noteHorizons();

  // The nodes' places in what is kept beside the trees.
  void doubt(JournalNode& node);
  void doubtBelow(JournalNode& node);
  void release(JournalNode& node);
  void releaseBelow(JournalNode& node);
  void bury(JournalNode& node, EventID id);
  void setWatch(JournalNode& node, int watch);
  void removeUnusedWatches();
  void hint(const JournalTree& tree);
  void reportOnce(bool& reported, const std::string& message);

  const std::vector<WatchedRoot> roots_;
  const Limits limits_;
  const std::function<EventID()> newID_;
  SystemLog& log_;
  ConcurrentQueue& pool_;
  FileSystems fileSystems_;
  OwnedDescriptor inotify_;
  std::vector<std::unique_ptr<JournalTree>> trees_;
  std::unordered_set<JournalNode*> doubted_;
  std::unordered_set<JournalNode*> uncovered_;
  std::unordered_multimap<int, JournalNode*> watches_;
  std::unordered_multimap<int, std::pair<JournalTree*, std::string>> approaches_;
  std::vector<int> watchesToRemove_;
  Hints hints_;
  bool watchesReported_ = false;
  bool instanceReported_ = false;
  bool sizeReported_ = false;
  bool overflowReported_ = false;
};

}  // namespace kel::platform
