#include <cerrno>
#include <utility>

#include "platform/linux/files/files.h"
#include "platform/linux/journal/journal_forest.h"

namespace kel::platform {

namespace {

std::size_t countBelow(const JournalNode& node, std::size_t most) {
  std::size_t count = 0;
  if (!node.directory) return count;
  for (const auto& [name, child] : node.directory->children) {
    count += (child->isGone ? 0 : 1) + countBelow(*child, most);
    if (count > most) break;
  }
  return count;
}

/// The end of the lines in the system log about entries whose changes cannot be told. Only the first entry of
/// each kind gets a line.
constexpr const char* unknowable = "; such entries count as changed whenever they are asked about";

/// True when the path leads nowhere, as opposed to where one cannot look.
bool meansMissing(int error) { return error == ENOENT || error == ENOTDIR; }

}  // namespace

void JournalForest::install(DirectoryLook& look, EventID id) {
  JournalNode& node = *look.node;
  const bool isDoubted = std::exchange(node.isDoubted, false);
  if (look.hasRecord) {
    const bool led = node.record.leadsToDirectory() && node.record.target.inode == look.record.target.inode;
    installRecord(node, std::move(look.record), isDoubted || !isCovered(*node.parent), id);
    if (node.isBoundless && isAsked_) JournalTree::markChanged(node, id);
    if (!led) return;  // what it leads to now has been queued
  }
  if (look.isListing && node.directory) installListing(look, isDoubted, id);
}

void JournalForest::installRecord(JournalNode& node, EntryRecord record, bool isDoubted, EventID id) {
  const EntryRecord before = std::exchange(node.record, std::move(record));
  const EntryRecord& now = node.record;
  // Of other entries an event has told already.
  const bool isUntold = isDoubted || changesUnseen(before) || changesUnseen(now);
  if (isUntold && !isUnchanged(before, now)) {
    JournalTree::markChanged(node, id);
    if (isDoubted) hint(*node.tree);
  }
  const bool isSameDirectory = before.leadsToDirectory() && now.leadsToDirectory() &&
                               before.status.kind == now.status.kind &&
                               before.target.inode == now.target.inode;
  if (!isSameDirectory) {
    node.isBoundless = false;
    releaseBelow(node);
    if (node.directory) setWatch(node, -1);
    node.directory.reset();
    if (now.leadsToDirectory()) {
      node.directory = std::make_unique<JournalDirectory>();
      enqueue(node, false);
    }
  }
  if (now.isRacy && !now.digest) unsettled_.insert(&node);
  updateCover(node);
}

void JournalForest::installListing(DirectoryLook& look, bool isDoubted, EventID id) {
  JournalNode& node = *look.node;
  JournalDirectory& directory = *node.directory;
  // Only what was watched all the time has its changes told by events.
  isDoubted |= !isCovered(node) || directory.watch != look.watch;
  setWatch(node, look.watch);
  if (look.watchError == ENOSPC || look.watchError == ENOMEM) {
    reportOnce(exhaustionReported_,
               "Cannot watch all directories, changes in the others are found by looking: " +
                   errorText(look.watchError));
  }
  if (look.error != 0) return installFailure(look, id);
  if (!node.parent) {
    node.tree->device = look.device;
    node.tree->inode = look.own.inode;
  }
  const EntryStatus before = directory.listing;
  const EventID latest = node.latest;
  const bool isReplaced =
      before.kind != EntryKind::Unknown &&
      (before.inode != look.own.inode || directory.fileSystem != look.fileSystem.identity);
  const bool isChanged = isReplaced || directory.error != 0;
  if (isChanged) {
    JournalTree::markChanged(node, id);
  } else if (isDoubted && before.kind != EntryKind::Unknown && !(before == look.own)) {
    JournalTree::markListed(node, id);
  }
  installNames(look, isDoubted || isChanged, id);
  const bool wasKnown = isChanged || before.kind != EntryKind::Unknown;
  if (isDoubted && wasKnown && node.latest != latest) hint(*node.tree);
  directory.listing = look.own;
  directory.listingIsSound = !look.ownIsRacy && look.fileSystem.notifies;
  directory.fileSystem = look.fileSystem.identity;
  directory.notifies = look.fileSystem.notifies;
  directory.error = 0;
  if (look.ownIsRacy) unsettled_.insert(&node);
  updateCover(node);
  enforceLimits(node);
}

void JournalForest::installFailure(DirectoryLook& look, EventID id) {
  JournalNode& node = *look.node;
  JournalDirectory& directory = *node.directory;
  if (look.error == E2BIG) {
    noteTooLarge(*node.tree);
    return enqueue(node, true);
  }
  // Where one cannot look everything may have changed, whenever it is asked about.
  const bool wasThere = directory.error == 0 && directory.listing.kind != EntryKind::Unknown;
  const bool isMissingRoot = !node.parent && meansMissing(look.error);
  if (wasThere || directory.error != look.error || (!meansMissing(look.error) && isAsked_)) {
    const bool isFirstLook = isMissingRoot && directory.error == 0 && !wasThere;
    if (!isFirstLook) JournalTree::markChanged(node, id);
    if (!isFirstLook && directory.error != look.error) hint(*node.tree);
  }
  if (!meansMissing(look.error)) {
    reportOnce(unreadableReported_, errorLine(node.tree->pathOf(node), look.error) + unknowable);
  }
  releaseBelow(node);
  directory.listing = {};
  directory.listingIsSound = false;
  directory.error = look.error;
  if (!node.parent) {
    node.tree->device = isMissingRoot ? 0 : look.device;
    node.tree->inode = 0;
  }
  updateCover(node);
}

void JournalForest::installNames(DirectoryLook& look, bool isDoubted, EventID id) {
  JournalNode& node = *look.node;
  for (auto& [child, record] : look.recorded) {
    installRecord(*child, std::move(record), isDoubted, id);
  }
  for (JournalNode* child : look.gone) {
    release(*child);
    node.tree->bury(*child, id);
  }
  for (auto& [name, record] : look.added) {
    const auto known = node.directory->children.find(name);
    if (known != node.directory->children.end()) {
      release(*known->second);
      known->second->directory.reset();
    }
    JournalNode& child = node.tree->add(node, name, {});
    installRecord(child, std::move(record), false, id);
    JournalTree::markChanged(child, id);
  }
  for (JournalNode* child : look.suspected) enqueue(*child, true);
  if (!look.gone.empty() || !look.added.empty()) JournalTree::markListed(node, id);
}

void JournalForest::enforceLimits(JournalNode& directory) {
  JournalTree& tree = *directory.tree;
  JournalNode* link = outermostLink(directory);
  if (link && countBelow(*link, limits_.mostBehindLink) > limits_.mostBehindLink) {
    becomeEmptyDirectory(*link);
    link->isBoundless = true;
    // What was just found below it is forgotten before it could be told.
    JournalTree::markChanged(*link, newID_());
    reportOnce(boundlessReported_, tree.pathOf(*link) + ": leads to too much" + unknowable);
    updateCover(*link);
  }
  if (tree.nodeCount > limits_.mostEntries) noteTooLarge(tree);
  if (tree.vanishedCount > limits_.mostVanished) tree.forgetVanished(newID_());
}

}  // namespace kel::platform
