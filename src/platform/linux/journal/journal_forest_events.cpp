#include <algorithm>
#include <array>
#include <cerrno>
#include <climits>
#include <cstring>
#include <deque>
#include <sys/inotify.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include "platform/linux/files/files.h"
#include "platform/linux/journal/journal_forest.h"

namespace kel::platform {

void JournalForest::readEvents() {
  if (!inotify_) return;
  int left = 0;
  // Only as much as is there now: while somebody changes files without a pause, reading until nothing is left
  // would never end.
  if (ioctl(inotify_.get(), FIONREAD, &left) != 0 || left <= 0) return;
  const EventID id = newID_();
  alignas(inotify_event) std::array<char, 65536> buffer;
  while (left > 0) {
    const ssize_t length = read(inotify_.get(), buffer.data(), buffer.size());
    if (length < 0 && errno == EINTR) continue;
    if (length <= 0) break;
    left -= static_cast<int>(length);
    for (ssize_t at = 0; at < length;) {
      inotify_event event;
      const char* start = &buffer[static_cast<std::size_t>(at)];
      std::memcpy(&event, start, sizeof event);
      at += static_cast<ssize_t>(sizeof event + event.len);
      const std::string_view name(start + sizeof event, event.len > 0 ? strlen(start + sizeof event) : 0);
      if (event.mask & IN_Q_OVERFLOW) {
        reportOnce(overflowReported_,
                   "Changes came faster than they could be told: looking at everything again");
        doubtEverything();
        // A look may have recorded what the lost events were to tell.
        for (const auto& tree : trees_) tree->forgetBefore(id);
        continue;
      }
      noteApproach(event.wd, event.mask, name);
      std::vector<JournalNode*> nodes;
      const auto [first, last] = watches_.equal_range(event.wd);
      for (auto entry = first; entry != last; ++entry) nodes.push_back(entry->second);
      for (JournalNode* node : nodes) {
        // A directory may hold links to itself: with one of them its other nodes vanish.
        if (!releasedInBatch_.contains(node)) applyEvent(*node, event.mask, name, id);
      }
      if (!releasedInBatch_.empty()) releasedInBatch_ = {};
      if (event.mask & IN_IGNORED) noteLostWatch(event.wd);
    }
  }
  removeUnusedWatches();
}

void JournalForest::applyEvent(JournalNode& directory, std::uint32_t mask, std::string_view name,
                               EventID id) {
  hint(*directory.tree);
  // Elsewhere events are not the whole truth, and what they tell is found by looking.
  if (!isCovered(directory)) return;
  if (name.empty()) {
    if ((mask & IN_ATTRIB) && !directory.parent) noteAttributes(directory, id);
  } else if (mask & (IN_DELETE | IN_MOVED_FROM)) {
    noteDisappearance(directory, name, (mask & IN_MOVED_FROM) != 0, id);
  } else if (mask & (IN_CREATE | IN_MOVED_TO)) {
    noteAppearance(directory, name, (mask & IN_ISDIR) != 0, id);
  } else if (mask & (IN_MODIFY | IN_CLOSE_WRITE | IN_ATTRIB)) {
    noteChange(directory, name, id);
  }
}

void JournalForest::noteNames(JournalNode& directory, EventID id) {
  JournalTree::markListed(directory, id);
  unsettled_.insert(&directory);
  enforceLimits(directory);
}

void JournalForest::noteDisappearance(JournalNode& directory, std::string_view name, bool wasMoved,
                                      EventID id) {
  const auto child = directory.directory->children.find(name);
  if (child != directory.directory->children.end() && !child->second->isGone) {
    release(*child->second);
    directory.tree->bury(*child->second, id);
  }
  noteNames(directory, id);
  // When two entries are exchanged each is first told to have come and then to have gone.
  struct stat status {};
  const std::string path = directory.tree->pathOf(directory).append(1, '/').append(name);
  if (wasMoved && lstat(path.c_str(), &status) == 0) {
    noteAppearance(directory, name, S_ISDIR(status.st_mode), id);
  }
}

/// New permissions or another owner of a directory can let the user into places below it, or shut them off:
/// all of it has to be looked at again.
void JournalForest::noteAttributes(JournalNode& directory, EventID id) {
  JournalTree::markListed(directory, id);
  doubtBelow(directory);
}

void JournalForest::noteAppearance(JournalNode& directory, std::string_view name, bool isDirectory,
                                   EventID id) {
  // What is not noted is found when there is room again.
  if (directory.tree->isTooLarge) return enqueue(directory, true);
  const auto known = directory.directory->children.find(name);
  if (known != directory.directory->children.end()) {
    release(*known->second);
    known->second->directory.reset();
    known->second->isBoundless = false;
  } else if (directory.tree->nodeCount >= limits_.mostEntries) {
    noteTooLarge(*directory.tree);
    noteNames(directory, id);
    return enqueue(directory, true);
  }
  EntryRecord record;
  record.isKnown = isDirectory;
  if (isDirectory) record.status.kind = EntryKind::Directory;
  JournalNode& child = directory.tree->add(directory, name, std::move(record));
  JournalTree::markChanged(child, id);
  enqueue(child, false);
  noteNames(directory, id);
}

void JournalForest::noteChange(JournalNode& directory, std::string_view name, EventID id) {
  const auto found = directory.directory->children.find(name);
  if (found == directory.directory->children.end() || found->second->isGone) return enqueue(directory, false);
  JournalNode& child = *found->second;
  if (child.record.isDirectory()) return noteAttributes(child, id);
  child.record.isKnown = false;
  JournalTree::markChanged(child, id);
  enqueue(child, false);
}

void JournalForest::noteLostWatch(int watch) {
  std::vector<JournalNode*> nodes;
  const auto [first, last] = watches_.equal_range(watch);
  for (auto entry = first; entry != last; ++entry) nodes.push_back(entry->second);
  for (JournalNode* node : nodes) {
    setWatch(*node, -1);
    doubtBelow(*node);
  }
}

void JournalForest::noteApproach(int watch, std::uint32_t mask, std::string_view name) {
  const auto [first, last] = approaches_.equal_range(watch);
  for (auto entry = first; entry != last; ++entry) {
    const auto& [tree, component] = entry->second;
    if (name != component && !(mask & (IN_DELETE_SELF | IN_MOVE_SELF | IN_IGNORED))) continue;
    tree->approachChanged = true;
    hint(*tree);
  }
}

/// Watches the directories on the way to the root, links followed one by one, for the name that comes next:
/// the root's appearance, and another one in its place, are seen there. What cannot be watched is left out:
/// every question looks where the path leads.
void JournalForest::watchApproach(JournalTree& tree) {
  constexpr std::uint32_t mask = IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO | IN_ATTRIB |
                                 IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR | IN_MASK_ADD;
  constexpr int mostComponents = 256;
  if (!inotify_) return;
  std::erase_if(approaches_, [&](const auto& entry) {
    if (entry.second.first == &tree) watchesToRemove_.push_back(entry.first);
    return entry.second.first == &tree;
  });
  std::deque<std::string> components;
  const auto prepend = [&components](std::string_view path) {
    auto place = components.begin();
    while (!path.empty()) {
      const std::size_t end = std::min(path.find('/'), path.size());
      if (end > 0) place = std::next(components.insert(place, std::string(path.substr(0, end))));
      path.remove_prefix(std::min(end + 1, path.size()));
    }
  };
  prepend(tree.path());
  std::string at(1, '/');
  for (int count = 0; !components.empty() && count < mostComponents; ++count) {
    const std::string name = std::move(components.front());
    components.pop_front();
    const int watch = inotify_add_watch(inotify_.get(), at.c_str(), mask);
    if (watch >= 0) approaches_.emplace(watch, std::pair(&tree, name));
    std::string next = at;
    next.append(next.ends_with('/') ? "" : "/").append(name);
    std::array<char, PATH_MAX> text;
    const ssize_t length = readlink(next.c_str(), text.data(), text.size());
    if (length >= 0) {
      const std::string_view target(text.data(), static_cast<std::size_t>(length));
      prepend(target);
      if (target.starts_with('/')) at.assign(1, '/');
    } else if (isDirectory(next)) {
      at = std::move(next);
    } else {
      break;
    }
  }
  removeUnusedWatches();
}

}  // namespace kel::platform
