#include "platform/linux/journal/journal_forest.h"

#include <algorithm>
#include <atomic>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <utility>

#include "platform/linux/files/files.h"

namespace kel::platform {

JournalForest::JournalForest(std::vector<WatchedRoot> roots, Limits limits, std::function<EventID()> newID,
                             SystemLog& log, ConcurrentQueue& pool)
    : limits_(limits), newID_(std::move(newID)), log_(log), pool_(pool) {
  if (limits_.live) {
    inotify_ = OwnedDescriptor(inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
    if (!inotify_) log_.write("Cannot watch directories: " + errorText(errno));
  }
  for (WatchedRoot& root : roots) {
    trees_.push_back(std::make_unique<JournalTree>(std::move(root)));
    enqueue(trees_.back()->root(), true);
  }
}

void JournalForest::restore(std::vector<std::unique_ptr<JournalTree>> trees) {
  for (std::unique_ptr<JournalTree>& restored : trees) {
    const auto place = std::find_if(trees_.begin(), trees_.end(), [&restored](const auto& tree) {
      return tree->path() == restored->path();
    });
    if (place == trees_.end()) continue;
    *place = std::move(restored);
    doubtBelow((*place)->root());
  }
}

void JournalForest::questionUncovered(const std::vector<JournalTree*>& trees) {
  for (JournalTree* tree : trees) {
    if (std::exchange(tree->approachChanged, false)) {
      watchApproach(*tree);
      // What was looked at while the path led elsewhere was another directory, even when it is back by now.
      doubtBelow(tree->root());
    }
    struct stat status {};
    const bool exists = stat(tree->path().c_str(), &status) == 0 && S_ISDIR(status.st_mode);
    if (!exists) status = {};
    if (status.st_dev != tree->device || status.st_ino != tree->inode) enqueue(tree->root(), true);
    if (tree->isTooLarge && tree->nodeCount < limits_.mostEntries / 4 * 3) tree->isTooLarge = false;
  }
  if (!inotify_) {
    for (JournalTree* tree : trees) doubtBelow(tree->root());
    return;
  }
  for (JournalNode* node : uncovered_) {
    if (std::find(trees.begin(), trees.end(), node->tree) != trees.end()) enqueue(*node, true);
  }
}

void JournalForest::questionUnsettled() {
  for (JournalNode* node : std::exchange(unsettled_, {})) {
    // What no event covers was compared when it was looked at, and must not be taken for granted now.
    if (isCovered(node->directory ? *node : *node->parent)) enqueue(*node, false);
  }
}

void JournalForest::doubtEverything() {
  for (const auto& tree : trees_) {
    tree->approachChanged = true;
    doubtBelow(tree->root());
    hint(*tree);
  }
}

bool JournalForest::lookAtSome(const std::vector<JournalTree*>& trees, LookMode mode,
                               std::chrono::steady_clock::time_point deadline) {
  constexpr std::size_t batch = 512;
  std::vector<JournalNode*> nodes;
  for (JournalTree* tree : trees) {
    while (!tree->isTooLarge && !tree->pending.empty() && nodes.size() < batch) {
      nodes.push_back(tree->pending.front());
      dequeue(*nodes.back());
    }
  }
  if (nodes.empty()) return false;
  isAsked_ = mode == LookMode::InParallel;
  LookSettings settings;
  settings.watchMask = IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO | IN_MODIFY | IN_CLOSE_WRITE |
                       IN_ATTRIB | IN_DELETE_SELF | IN_MOVE_SELF | IN_EXCL_UNLINK | IN_MASK_ADD;
  settings.inotify = inotify_.get();
  std::atomic<std::int64_t> watchesLeft =
      static_cast<std::int64_t>(limits_.mostWatches) - static_cast<std::int64_t>(watches_.size());
  settings.watchesLeft = &watchesLeft;
  settings.alwaysDigest = !inotify_ || mode == LookMode::ForGood;
  settings.mostEntries = limits_.mostEntries;
  settings.deadline = deadline;
  std::vector<DirectoryLook> looks(nodes.size());
  constexpr std::chrono::milliseconds portion{10};
  const auto now = std::chrono::steady_clock::now();
  const auto latestStart = mode == LookMode::InBackground ? std::min(deadline, now + portion) : deadline;
  std::atomic<std::size_t> found = 0;
  // A share of several nodes is worth the hand-over to another thread.
  constexpr std::size_t share = 16;
  const auto lookAtShare = [&](std::size_t index) {
    const std::size_t end = std::min(nodes.size(), (index + 1) * share);
    for (std::size_t at = index * share; at < end; ++at) {
      const bool isEnough = found > limits_.mostEntries || std::chrono::steady_clock::now() > latestStart;
      if (at > 0 && isEnough) continue;
      looks[at] = lookAt(*nodes[at], nodes[at]->tree->pathOf(*nodes[at]), settings);
      found += looks[at].added.size() + looks[at].recorded.size();
    }
  };
  const std::size_t shares = (nodes.size() + share - 1) / share;
  if (mode != LookMode::InBackground && shares > 1) {
    pool_.apply(shares, lookAtShare);
  } else {
    for (std::size_t index = 0; index < shares; ++index) lookAtShare(index);
  }

  const EventID id = newID_();
  bool isLate = false;
  for (std::size_t at = 0; at < nodes.size(); ++at) {
    DirectoryLook& look = looks[at];
    isLate |= look.isLate;
    if (look.watch >= 0) watchesToRemove_.push_back(look.watch);  // when it is not installed
    // What an earlier look of the batch found vanished, or exchanged, is no longer there to be installed.
    if (releasedInBatch_.contains(nodes[at])) continue;
    if (look.node && !look.isLate) {
      install(look, id);
    } else {
      enqueue(*nodes[at], false);
    }
  }
  releasedInBatch_.clear();
  removeUnusedWatches();
  return !isLate && std::any_of(trees.begin(), trees.end(), [](const JournalTree* tree) {
    return !tree->isTooLarge && !tree->pending.empty();
  });
}

bool JournalForest::needsLooks() const {
  return !uncovered_.empty() || std::any_of(trees_.begin(), trees_.end(), [](const auto& tree) {
    return !tree->isTooLarge && !tree->pending.empty();
  });
}

void JournalForest::enqueue(JournalNode& node, bool isDoubted) {
  node.isDoubted |= isDoubted;
  if (node.pending) return;
  node.pending = node.tree->pending.insert(node.tree->pending.end(), &node);
}

void JournalForest::dequeue(JournalNode& node) {
  if (!node.pending) return;
  node.tree->pending.erase(*node.pending);
  node.pending.reset();
}

/// Other entries than directories are looked at with the directory that they are in.
void JournalForest::doubtBelow(JournalNode& node) {
  if (node.isGone) return;
  if (node.directory || changesUnseen(node.record) || !node.parent) enqueue(node, true);
  if (!node.directory) return;
  for (const auto& [name, child] : node.directory->children) doubtBelow(*child);
}

void JournalForest::release(JournalNode& node) {
  releasedInBatch_.insert(&node);
  releaseBelow(node);
  if (node.directory) setWatch(node, -1);
  dequeue(node);
  uncovered_.erase(&node);
  unsettled_.erase(&node);
  node.isDoubted = false;
}

void JournalForest::releaseBelow(JournalNode& node) {
  if (!node.directory) return;
  releasedInBatch_.insert(&node);  // what a look found below it is no longer there either
  for (const auto& [name, child] : node.directory->children) release(*child);
  node.tree->clear(node);
}

void JournalForest::becomeEmptyDirectory(JournalNode& node) {
  releaseBelow(node);
  if (node.directory) setWatch(node, -1);
  node.directory = std::make_unique<JournalDirectory>();
}

void JournalForest::setWatch(JournalNode& node, int watch) {
  int& current = node.directory->watch;
  if (current == watch) return;
  // However many links lead to a directory, an event there costs little; the others are uncovered.
  constexpr std::size_t mostSharing = 64;
  if (watch >= 0 && watches_.count(watch) >= mostSharing) watch = -1;
  if (current >= 0) {
    const auto [first, last] = watches_.equal_range(current);
    watches_.erase(std::find_if(first, last, [&node](const auto& entry) { return entry.second == &node; }));
    watchesToRemove_.push_back(current);
  }
  current = watch;
  if (watch >= 0) watches_.emplace(watch, &node);
}

/// Only now: until the batch is installed another node may turn out to be the same directory.
void JournalForest::removeUnusedWatches() {
  for (const int watch : std::exchange(watchesToRemove_, {})) {
    if (!watches_.contains(watch) && !approaches_.contains(watch)) inotify_rm_watch(inotify_.get(), watch);
  }
}

bool JournalForest::isCovered(JournalNode& directory) const {
  return inotify_ && !outermostLink(directory) && directory.directory->watch >= 0 &&
         directory.directory->notifies && directory.directory->error == 0;
}

void JournalForest::updateCover(JournalNode& node) {
  // A root that is not there is found by its path, whenever something is asked.
  const bool isMissing = !node.parent && node.tree->inode == 0 && node.directory->error != EACCES;
  const bool isUncovered =
      changesUnseen(node.record) || node.isBoundless || (node.directory && !isMissing && !isCovered(node));
  if (isUncovered) {
    uncovered_.insert(&node);
  } else {
    uncovered_.erase(&node);
  }
}

void JournalForest::noteTooLarge(JournalTree& tree) {
  tree.isTooLarge = true;
  reportOnce(sizeReported_, tree.path() + ": too many entries to tell what changed");
}

void JournalForest::hint(const JournalTree& tree) {
  (tree.holdsApplications() ? hints_.applications : hints_.services) = true;
}

void JournalForest::reportOnce(bool& reported, const std::string& message) {
  if (!std::exchange(reported, true)) log_.write(message);
}

}  // namespace kel::platform
