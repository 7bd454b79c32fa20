#include "platform/linux/journal/journal_forest.h"

#include <algorithm>
#include <cerrno>
#include <sys/inotify.h>
#include <utility>

#include "platform/linux/files/files.h"

namespace kel::platform {

JournalForest::JournalForest(std::vector<WatchedRoot> roots, Limits limits, std::function<EventID()> newID,
                             SystemLog& log, ConcurrentQueue& pool)
    : roots_(std::move(roots)), limits_(std::move(limits)), newID_(std::move(newID)), log_(log), pool_(pool) {
  for (const WatchedRoot& root : roots_) {
    trees_.push_back(std::make_unique<JournalTree>(root));
    doubted_.insert(&trees_.back()->root());
  }
}

void JournalForest::restore(std::vector<std::unique_ptr<JournalTree>> trees) {
  for (std::unique_ptr<JournalTree>& restored : trees) {
    const auto place = std::ranges::find(trees_, restored->path(), &JournalTree::path);
    if (place == trees_.end()) continue;
    doubted_.erase(&(*place)->root());
    *place = std::move(restored);
    doubtBelow((*place)->root());
  }
}

JournalTree* JournalForest::treeOf(std::string_view path) const {
  JournalTree* found = nullptr;
  for (const auto& tree : trees_) {
    if (tree->covers(path) && (!found || found->path().size() < tree->path().size())) found = tree.get();
  }
  return found;
}

bool JournalForest::openEvents() {
  if (inotify_) return false;
  errno = EMFILE;
  if (!limits_.mayWatch || limits_.mayWatch()) {
    inotify_ = OwnedDescriptor(inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
  }
  if (!inotify_) {
    reportOnce(instanceReported_,
               "Cannot watch directories now, changes are found by looking: " + errorText(errno));
    return false;
  }
  doubtEverything();
  return true;
}

void JournalForest::doubtUncovered() {
  for (const auto& tree : trees_) {
    if (std::exchange(tree->approachChanged, false)) watchApproach(*tree);
    doubt(tree->root());
    if (!tree->isTooLarge || tree->nodeCount - tree->goneCount >= limits_.mostRecords / 4 * 3) continue;
    tree->isTooLarge = false;
    releaseBelow(tree->root());
    tree->root().record = {};
    tree->horizon = JournalTree::noHorizon;
  }
  for (JournalNode* node : std::exchange(uncovered_, {})) doubt(*node);
}

void JournalForest::doubtEverything() {
  fileSystems_.forget();
  for (const auto& tree : trees_) {
    tree->approachChanged = true;
    doubtBelow(tree->root());
  }
}

EventID JournalForest::latestEvent() const {
  EventID latest = 0;
  for (const auto& tree : trees_) {
    latest = std::max(latest, tree->root().latest);
    if (tree->horizon != JournalTree::noHorizon) latest = std::max(latest, tree->horizon);
  }
  return latest;
}

JournalForest::Size JournalForest::size() const {
  Size size{trees_.size(), 0};
  std::unordered_set<int> watches;
  for (const auto& tree : trees_) size.records += tree->nodeCount;
  for (const auto& [watch, node] : watches_) watches.insert(watch);
  size.watches = watches.size();
  return size;
}

void JournalForest::doubt(JournalNode& node) {
  if (node.state == RecordState::Gone) return;
  if (node.state != RecordState::Doubted) ++node.tree->doubtedCount;
  uncovered_.erase(&node);
  node.state = RecordState::Doubted;
  doubted_.insert(&node);
}

void JournalForest::doubtBelow(JournalNode& node) {
  doubt(node);
  for (const auto& [name, child] : node.children) doubtBelow(*child);
}

/// Before the node is destroyed or buried.
void JournalForest::release(JournalNode& node) {
  releaseBelow(node);
  setWatch(node, -1);
  doubted_.erase(&node);
  uncovered_.erase(&node);
}

void JournalForest::releaseBelow(JournalNode& node) {
  for (const auto& [name, child] : node.children) release(*child);
  node.tree->clear(node);
}

void JournalForest::bury(JournalNode& node, EventID id) {
  JournalTree& tree = *node.tree;
  release(node);
  tree.bury(node, id);
  JournalTree::markListed(*node.parent, id);
  hint(tree);
}

void JournalForest::setWatch(JournalNode& node, int watch) {
  if (node.watch == watch) return;
  // However many links lead to one place, an event there costs little; the others are uncovered.
  constexpr std::size_t mostSharing = 64;
  if (watch >= 0 && watches_.count(watch) >= mostSharing) watch = -1;
  if (node.watch >= 0) {
    const auto [first, last] = watches_.equal_range(node.watch);
    watches_.erase(std::find_if(first, last, [&node](const auto& entry) { return entry.second == &node; }));
    watchesToRemove_.push_back(node.watch);
  }
  node.watch = watch;
  if (watch >= 0) watches_.emplace(watch, &node);
}

/// Only when a batch is installed: until then another record may turn out to be of the same inode.
void JournalForest::removeUnusedWatches() {
  for (const int watch : std::exchange(watchesToRemove_, {})) {
    if (!watches_.contains(watch) && !approaches_.contains(watch)) inotify_rm_watch(inotify_.get(), watch);
  }
}

void JournalForest::hint(const JournalTree& tree) {
  (tree.holdsApplications() ? hints_.applications : hints_.services) = true;
}

void JournalForest::reportOnce(bool& reported, const std::string& message) {
  if (!std::exchange(reported, true)) log_.write(message);
}

}  // namespace kel::platform
