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
#include "platform/linux/journal/directory_look.h"
#include "platform/linux/journal/journal_tree.h"
#include "platform/system_log.h"
#include "platform/work_queue.h"

namespace kel::platform {

/// Keeps the trees of the watched roots in step with the disk: by looking at what is not known for certain,
/// and by the kernel's events for what is watched.
///
/// What no event tells of (links and what they lead to, files with further names, directories without a watch
/// or on file systems that do not notify) is uncovered: it has to be looked at again for every question.
///
/// Used by one thread at a time; only the looks of one batch run in parallel. Borrows `log` and `pool`.
class JournalForest {
 public:
  struct Limits {
    bool live = true;                    ///< false: no watches, everything is uncovered
    std::size_t mostWatches = 100'000;   ///< further directories are uncovered
    std::size_t mostEntries = 200'000;   ///< of one root; beyond that nothing is told of it
    std::size_t mostBehindLink = 1'000;  ///< entries; a link to more counts as changed whenever asked about
    std::size_t mostVanished = 20'000;   ///< entries that are remembered as vanished
  };

  /// What something happened to, whether it can be told precisely or not.
  struct Hints {
    bool services = false;
    bool applications = false;
  };

  /// `newID` gives the ID of the next event.
  JournalForest(std::vector<WatchedRoot> roots, Limits limits, std::function<EventID()> newID, SystemLog& log,
                ConcurrentQueue& pool);
  JournalForest(const JournalForest&) = delete;
  JournalForest& operator=(const JournalForest&) = delete;

  /// Takes over what an index file held. Once, before anything else.
  void restore(std::vector<std::unique_ptr<JournalTree>> trees);

  const std::vector<std::unique_ptr<JournalTree>>& trees() const { return trees_; }

  /// The descriptor that becomes readable when there are events; -1 when nothing is live.
  int eventDescriptor() const { return inotify_.get(); }

  /// Notes the events so far.
  void readEvents();

  /// Queues what has to be looked at before questions about these trees can be answered: another directory in
  /// a root's place, what is uncovered.
  void questionUncovered(const std::vector<JournalTree*>& trees);

  /// Queues what a later record could not be compared with, so that it can be recorded again.
  void questionUnsettled();

  /// Events may have been lost below every root.
  void doubtEverything();

  enum class LookMode {
    InBackground,  ///< on this thread alone
    InParallel,
    ForGood  ///< so that the records can be compared with by another process
  };

  /// Looks at some of what is queued in these trees, until the deadline; true when there is more and it makes
  /// sense to go on.
  bool lookAtSome(const std::vector<JournalTree*>& trees, LookMode mode,
                  std::chrono::steady_clock::time_point deadline);

  /// True when some change may be found only by looking.
  bool needsLooks() const;

  /// What happened since the last call.
  Hints takeHints() { return std::exchange(hints_, {}); }

 private:
  // Events.
  void applyEvent(JournalNode& directory, std::uint32_t mask, std::string_view name, EventID id);
  void noteAppearance(JournalNode& directory, std::string_view name, bool isDirectory, EventID id);
  void noteChange(JournalNode& directory, std::string_view name, EventID id);
  void noteDisappearance(JournalNode& directory, std::string_view name, bool wasMoved, EventID id);
  void noteNames(JournalNode& directory, EventID id);
  void noteAttributes(JournalNode& directory, EventID id);
  void noteLostWatch(int watch);
  void noteApproach(int watch, std::uint32_t mask, std::string_view name);
  void watchApproach(JournalTree& tree);

  // Looks.
  void install(DirectoryLook& look, EventID id);
  void installRecord(JournalNode& node, EntryRecord record, bool isDoubted, EventID id);
  void installListing(DirectoryLook& look, bool isDoubted, EventID id);
  void installFailure(DirectoryLook& look, EventID id);
  void installNames(DirectoryLook& look, bool isDoubted, EventID id);
  void enforceLimits(JournalNode& directory);

  // The nodes' places in what is kept beside the trees.
  void enqueue(JournalNode& node, bool isDoubted);
  void dequeue(JournalNode& node);
  void doubtBelow(JournalNode& node);
  void release(JournalNode& node);
  void releaseBelow(JournalNode& node);
  void becomeEmptyDirectory(JournalNode& node);
  void setWatch(JournalNode& node, int watch);
  void removeUnusedWatches();
  void updateCover(JournalNode& node);
  bool isCovered(JournalNode& directory) const;
  void noteTooLarge(JournalTree& tree);
  void hint(const JournalTree& tree);
  void reportOnce(bool& reported, const std::string& message);

  const Limits limits_;
  const std::function<EventID()> newID_;
  SystemLog& log_;
  ConcurrentQueue& pool_;
  OwnedDescriptor inotify_;
  std::vector<std::unique_ptr<JournalTree>> trees_;
  std::unordered_multimap<int, JournalNode*> watches_;
  std::unordered_multimap<int, std::pair<JournalTree*, std::string>> approaches_;
  std::vector<int> watchesToRemove_;
  std::unordered_set<JournalNode*> uncovered_;
  std::unordered_set<JournalNode*> unsettled_;
  std::unordered_set<const JournalNode*> releasedInBatch_;
  Hints hints_;
  bool isAsked_ = false;  // the looks are for a question
  bool exhaustionReported_ = false;
  bool overflowReported_ = false;
  bool sizeReported_ = false;
  bool unreadableReported_ = false;
  bool boundlessReported_ = false;
};

}  // namespace kel::platform
