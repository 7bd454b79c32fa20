#include <algorithm>
#include <atomic>
#include <cerrno>
#include <string>

#include "platform/linux/files/files.h"
#include "platform/linux/journal/journal_forest.h"

namespace kel::platform {

bool JournalForest::lookAtSome(LookMode mode, std::chrono::steady_clock::time_point deadline) {
  const std::vector<JournalNode*> nodes = nextBatch();
  if (nodes.empty()) {
    noteHorizons();
    return false;
  }
  std::vector<RecordLook> looks = takeLooks(nodes, mode, deadline);
  const EventID id = newID_();
  bool isLate = true;
  for (std::size_t at = 0; at < nodes.size(); ++at) {
    if (!looks[at].isTaken) continue;
    isLate = false;
    install(*nodes[at], looks[at], id);
  }
  removeUnusedWatches();
  for (const auto& tree : trees_) {
    if (tree->goneCount > limits_.mostGone) tree->forgetGone(id);
  }
  return !isLate && std::chrono::steady_clock::now() < deadline;
}

/// Some of what is doubted and has nothing doubted above it: a watch on a directory comes before the look at
/// what is in it, and what vanishes with a parent is in no batch together with it.
std::vector<JournalNode*> JournalForest::nextBatch() const {
  constexpr std::size_t most = 1024;
  std::vector<JournalNode*> nodes;
  for (JournalNode* node : doubted_) {
    const JournalNode* above = node->parent;
    while (above && above->state != RecordState::Doubted) above = above->parent;
    if (!above) nodes.push_back(node);
    if (nodes.size() == most) break;
  }
  return nodes;
}

std::vector<RecordLook> JournalForest::takeLooks(const std::vector<JournalNode*>& nodes, LookMode mode,
                                                 std::chrono::steady_clock::time_point deadline) {
  const auto watched = static_cast<std::int64_t>(watches_.size());
  std::atomic<std::int64_t> watchesLeft = static_cast<std::int64_t>(limits_.mostWatches) - watched;
  constexpr std::chrono::milliseconds portion{10};
  if (mode == LookMode::InBackground) {
    deadline = std::min(deadline, std::chrono::steady_clock::now() + portion);
  }
  const LookSettings settings{fileSystems_, inotify_.get(), watchesLeft, deadline};
  std::vector<RecordLook> looks(nodes.size());
  // A share of several is worth the hand-over to another thread.
  constexpr std::size_t share = 32;
  const auto lookAtShare = [&](std::size_t index) {
    const std::size_t end = std::min(nodes.size(), (index + 1) * share);
    for (std::size_t at = index * share; at < end; ++at) {
      looks[at] = lookAt(*nodes[at], nodes[at]->tree->pathOf(*nodes[at]), settings);
    }
  };
  const std::size_t shares = (nodes.size() + share - 1) / share;
  if (mode == LookMode::InParallel && shares > 1) {
    pool_.apply(shares, lookAtShare);
  } else {
    for (std::size_t index = 0; index < shares; ++index) lookAtShare(index);
  }
  return looks;
}

void JournalForest::install(JournalNode& node, RecordLook& look, EventID id) {
  JournalTree& tree = *node.tree;
  if (look.watchError != 0) {
    reportOnce(watchesReported_,
               "Cannot watch all directories, changes in the others are found by looking: " +
                   errorText(look.watchError));
  }
  const EntryRecord& now = look.record;
  const bool isMissing = now.status.kind == EntryKind::Unknown && !now.isLink() && now.status.size == ENOENT;
  if (isMissing && node.parent && node.role != RecordRole::Information) {
    if (look.watch >= 0) watchesToRemove_.push_back(look.watch);
    return bury(node, id);
  }
  const bool isOther = !isSameEntry(node.record, now);
  if (look.differs) {
    const bool isListOnly = node.role == RecordRole::Folder && !isOther;
    isListOnly ? JournalTree::markListed(node, id) : JournalTree::markChanged(node, id);
    hint(tree);
  }
  if (!node.parent) installRoot(node, look);
  const bool doubtsChildren = isOther || node.tells != look.tells;
  node.record = std::move(look.record);
  setWatch(node, look.watch);
  if (!node.record.isDirectory()) {
    releaseBelow(node);
  } else if (node.role == RecordRole::Folder) {
    installNames(node, look, id);
  } else if (node.role == RecordRole::Bundle && node.children.empty()) {
    doubt(tree.add(node, JournalTree::informationName, RecordRole::Information));
  }
  if (doubtsChildren) {
    for (const auto& [name, child] : node.children) doubtBelow(*child);
  }
  settle(node, look);
}

void JournalForest::installRoot(JournalNode& root, RecordLook& look) {
  JournalTree& tree = *root.tree;
  if (look.chain == tree.chain) return;
  // By another way to what may be the same: nothing that was known of it counts.
  if (!tree.chain.empty() && !look.chain.empty()) tree.horizon = JournalTree::noHorizon;
  tree.chain = std::move(look.chain);
  tree.approachChanged = true;
}

void JournalForest::installNames(JournalNode& folder, const RecordLook& look, EventID id) {
  JournalTree& tree = *folder.tree;
  if (look.listingError != 0) {
    // Unlike what comes next, so that it counts as changed as long as it cannot be listed.
    folder.record.isRacy = true;
    folder.record.digest.reset();
  }
  if (!look.isListed) return;
  auto name = look.names.begin();
  std::vector<JournalNode*> vanished;
  std::vector<std::pair<const ListedName*, RecordRole>> appeared;
  const auto passNames = [&](const std::string* before) {
    for (; name != look.names.end() && (!before || name->name < *before); ++name) {
      if (const auto role = tree.roleOf(folder, *name)) appeared.emplace_back(&*name, *role);
    }
  };
  for (const auto& [known, child] : folder.children) {
    passNames(&known);
    const bool isListed = name != look.names.end() && name->name == known;
    const auto role = isListed ? tree.roleOf(folder, *name) : std::nullopt;
    if (role && child->state == RecordState::Gone) appeared.emplace_back(&*name, *role);
    if (!role && child->state != RecordState::Gone) vanished.push_back(child.get());
    if (isListed) ++name;
  }
  passNames(nullptr);
  for (JournalNode* node : vanished) bury(*node, id);
  for (const auto& [listed, role] : appeared) {
    tree.isTooLarge = tree.isTooLarge || tree.nodeCount >= limits_.mostRecords;
    if (tree.isTooLarge) break;
    JournalNode& node = tree.add(folder, listed->name, role);
    JournalTree::markChanged(node, id);
    doubted_.insert(&node);
  }
  if (tree.isTooLarge) reportOnce(sizeReported_, tree.path() + ": too many entries to tell what changed");
}

/// From Doubted to Covered or Uncovered.
void JournalForest::settle(JournalNode& node, const RecordLook& look) {
  const EntryStatus& status = node.record.status;
  node.tells = look.tells && node.watch >= 0;
  const bool isAbsent = status.kind == EntryKind::Unknown && status.size == ENOENT;
  const bool isCovered = (node.tells || isAbsent) && !node.record.isLink() && look.listingError == 0 &&
                         (!node.parent || node.parent->tells);
  doubted_.erase(&node);
  --node.tree->doubtedCount;
  node.state = isCovered ? RecordState::Covered : RecordState::Uncovered;
  // A root is looked at for every question anyway.
  if (!isCovered && node.parent) uncovered_.insert(&node);
}

void JournalForest::noteHorizons() {
  for (const auto& tree : trees_) {
    if (tree->horizon == JournalTree::noHorizon && tree->doubtedCount == 0) tree->horizon = newID_();
  }
}

}  // namespace kel::platform
