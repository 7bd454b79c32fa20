#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <sys/inotify.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include "platform/linux/files/files.h"
#include "platform/linux/journal/journal_forest.h"

namespace kel::platform {

void JournalForest::readEvents() {
  int left = 0;
  // Only as much as is there now: while somebody changes files without a pause, reading until nothing is left
  // would never end.
  if (!inotify_ || ioctl(inotify_.get(), FIONREAD, &left) != 0 || left <= 0) return;
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
      if (event.mask & IN_Q_OVERFLOW) noteOverflow(id);
      noteApproach(event.wd, event.mask, name, id);
      const auto [first, last] = watches_.equal_range(event.wd);
      for (auto entry = first; entry != last; ++entry) applyEvent(*entry->second, event.mask, name, id);
      if (event.mask & IN_IGNORED) noteLostWatch(event.wd);
    }
  }
}

void JournalForest::applyEvent(JournalNode& node, std::uint32_t mask, std::string_view name, EventID id) {
  const bool isDirectory = (mask & IN_ISDIR) != 0;
  if (!name.empty() && (mask & IN_ATTRIB)) return;  // told by the entry's own watch
  if (!name.empty() && node.role == RecordRole::Folder) return noteName(node, name, isDirectory, id);
  if (!name.empty()) {
    const auto child = node.children.find(name);
    if (child == node.children.end()) return;
    JournalTree::markChanged(*child->second, id);
    doubt(*child->second);
  } else if (node.role == RecordRole::Information) {
    // Also what may leave status and size alike.
    if (mask & (IN_MODIFY | IN_CLOSE_WRITE | IN_ATTRIB)) JournalTree::markChanged(node, id);
    doubt(node);
  } else {
    doubtBelow(node);
  }
  hint(*node.tree);
}

/// Something came to the folder, or went: which of both, if not both, the next look finds.
void JournalForest::noteName(JournalNode& folder, std::string_view name, bool isDirectory, EventID id) {
  if (!folder.tree->decides(name, isDirectory)) return;
  JournalTree::markListed(folder, id);
  doubt(folder);
  hint(*folder.tree);
  const auto child = folder.children.find(name);
  if (child == folder.children.end() || child->second->state == RecordState::Gone) return;
  JournalTree::markChanged(*child->second, id);
  doubtBelow(*child->second);
}

void JournalForest::noteOverflow(EventID id) {
  reportOnce(overflowReported_, "Changes came faster than they could be told: looking at everything again");
  doubtEverything();
  for (const auto& tree : trees_) {
    hint(*tree);
    // A look may have recorded what the lost events were to tell.
    if (tree->horizon != JournalTree::noHorizon) tree->horizon = id;
  }
}

void JournalForest::noteLostWatch(int watch) {
  const auto [first, last] = watches_.equal_range(watch);
  for (auto entry = first; entry != last; ++entry) {
    entry->second->watch = -1;
    doubtBelow(*entry->second);
  }
  watches_.erase(first, last);
  approaches_.erase(watch);
}

/// A directory on the way to a root moved or went, so that the root is another now, be it for a moment; or
/// the name came that was missing.
void JournalForest::noteApproach(int watch, std::uint32_t mask, std::string_view name, EventID id) {
  const auto [first, last] = approaches_.equal_range(watch);
  for (auto entry = first; entry != last; ++entry) {
    const auto& [tree, missing] = entry->second;
    const bool isFate = name.empty() && (mask & (IN_DELETE_SELF | IN_MOVE_SELF | IN_UNMOUNT));
    if (!isFate && (name.empty() || name != missing)) continue;
    tree->approachChanged = true;
    if (isFate) JournalTree::markChanged(tree->root(), id);
    doubtBelow(tree->root());
    hint(*tree);
  }
}

/// Watches the directories above the root for their own fate, and the last one that exists for the name that
/// is missing. Not above the home: what other programs do there would wake us for nothing, and a root that
/// appears is found by the next look in the background.
void JournalForest::watchApproach(JournalTree& tree) {
  constexpr std::uint32_t fate = IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR | IN_MASK_ADD;
  if (!inotify_) return;
  std::erase_if(approaches_, [&](const auto& entry) {
    if (entry.second.first == &tree) watchesToRemove_.push_back(entry.first);
    return entry.second.first == &tree;
  });
  removeUnusedWatches();
  const std::string& path = tree.path();
  for (std::size_t end = path.find('/'); end + 1 < path.size();) {
    const std::string above = path.substr(0, std::max<std::size_t>(end, 1));
    const std::size_t next = path.find('/', end + 1);
    const bool isLast = !isDirectory(path.substr(0, next));
    const bool isHome = !limits_.home.empty() && (above + "/").starts_with(limits_.home + "/");
    const std::uint32_t names = isLast && isHome ? IN_CREATE | IN_MOVED_TO : 0u;
    const int watch = inotify_add_watch(inotify_.get(), above.c_str(), fate | names);
    if (watch >= 0) approaches_.emplace(watch, std::pair(&tree, path.substr(end + 1, next - end - 1)));
    if (isLast) break;
    end = next;
  }
}

}  // namespace kel::platform
