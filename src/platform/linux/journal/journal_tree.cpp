#include "platform/linux/journal/journal_tree.h"

#include <algorithm>
#include <utility>

#include "property_lists/unicode.h"

namespace kel::platform {

namespace {

constexpr std::string_view applicationSuffix = ".app";

/// Tells the events at and below one node.
class EventCollection {
 public:
  EventCollection(EventID since, std::vector<JournalEvent>& events) : since_(since), events_(events) {}

  /// `path` is the node's, without a trailing "/"; it is left as it was.
  void addFrom(const JournalNode& node, std::string& path) {
    if (node.latest <= since_) return;
    if (node.changed > since_) {
      // With the trailing "/" the event covers all that is below, and no neighbour of a longer name.
      return add(node.role == RecordRole::Information ? path : path + "/", node.changed);
    }
    if (node.listed > since_) add(path + "/.", node.listed);
    const std::size_t length = path.size();
    for (const auto& [name, child] : node.children) {
      path.append(1, '/').append(name);
      addFrom(*child, path);
      path.resize(length);
    }
  }

  void add(std::string path, EventID id) { events_.push_back({std::move(path), 0, id}); }

 private:
  const EventID since_;
  std::vector<JournalEvent>& events_;
};

}  // namespace

JournalTree::JournalTree(WatchedRoot watchedRoot) : watchedRoot_(std::move(watchedRoot)) {
  root_.tree = this;
}

std::string JournalTree::pathOf(const JournalNode& node) const {
  std::vector<std::string_view> names;
  for (const JournalNode* at = &node; at->parent; at = at->parent) names.push_back(at->name);
  std::string path = watchedRoot_.path.substr(0, watchedRoot_.path.size() - 1);
  for (auto name = names.rbegin(); name != names.rend(); ++name) path.append(1, '/').append(*name);
  return path;
}

bool JournalTree::decides(std::string_view name, bool isDirectory) const {
  if (name.empty() || name.starts_with('.') || !isValidUTF8(name)) return false;
  return !holdsApplications() || isDirectory || name.ends_with(applicationSuffix) || name == informationName;
}

std::optional<RecordRole> JournalTree::roleOf(const JournalNode& folder, const ListedName& name) const {
  constexpr int deepest = 16;
  const bool leadsOn = name.kind == EntryKind::Directory || name.kind == EntryKind::Link;
  const bool isBundle = !holdsApplications() || name.name.ends_with(applicationSuffix);
  if (isBundle) return leadsOn ? std::optional(RecordRole::Bundle) : std::nullopt;
  int depth = 0;
  for (const JournalNode* at = &folder; at->parent; at = at->parent) ++depth;
  if (name.kind != EntryKind::Directory || depth >= deepest) return std::nullopt;
  return RecordRole::Folder;
}

JournalNode& JournalTree::add(JournalNode& parent, std::string_view name, RecordRole role) {
  const auto place = parent.children.lower_bound(name);
  if (place != parent.children.end() && place->first == name) {
    place->second->state = RecordState::Doubted;
    place->second->role = role;
    ++doubtedCount;
    --goneCount;
    return *place->second;
  }
  const auto added = parent.children.emplace_hint(place, std::string(name), std::make_unique<JournalNode>());
  JournalNode& node = *added->second;
  node.tree = this;
  node.parent = &parent;
  node.name = added->first;
  node.role = role;
  ++nodeCount;
  ++doubtedCount;
  return node;
}

void JournalTree::bury(JournalNode& node, EventID id) {
  clear(node);
  if (node.state == RecordState::Doubted) --doubtedCount;
  node.state = RecordState::Gone;
  node.record = {};
  node.tells = false;
  node.listed = 0;
  ++goneCount;
  markChanged(node, id);
}

void JournalTree::clear(JournalNode& node) {
  for (const auto& [name, child] : node.children) {
    clear(*child);
    --nodeCount;
    if (child->state == RecordState::Gone) --goneCount;
    if (child->state == RecordState::Doubted) --doubtedCount;
  }
  node.children.clear();
}

void JournalTree::forgetGone(EventID newHorizon) {
  if (horizon != noHorizon) horizon = std::max(horizon, newHorizon);
  forgetGoneBelow(root_);
}

void JournalTree::forgetGoneBelow(JournalNode& node) {
  const std::size_t forgotten = std::erase_if(
      node.children, [](const auto& child) { return child.second->state == RecordState::Gone; });
  nodeCount -= forgotten;
  goneCount -= forgotten;
  for (const auto& [name, child] : node.children) forgetGoneBelow(*child);
}

void JournalTree::markChanged(JournalNode& node, EventID id) {
  node.changed = id;
  for (JournalNode* at = &node; at && at->latest < id; at = at->parent) at->latest = id;
}

void JournalTree::markListed(JournalNode& node, EventID id) {
  node.listed = id;
  for (JournalNode* at = &node; at && at->latest < id; at = at->parent) at->latest = id;
}

bool JournalTree::covers(std::string_view path) const {
  const std::string& root = watchedRoot_.path;
  return path.starts_with(root) || (path.size() + 1 == root.size() && root.starts_with(path));
}

void JournalTree::addEvents(std::string_view path, EventID since, std::vector<JournalEvent>& events,
                            bool& rootChanged) const {
  EventCollection collection(since, events);
  if (root_.changed > since) rootChanged = true;
  std::string at = watchedRoot_.path.substr(0, watchedRoot_.path.size() - 1);
  const JournalNode* node = &root_;
  std::string_view rest = path.substr(std::min(path.size(), watchedRoot_.path.size()));
  while (!rest.empty()) {
    const std::size_t end = std::min(rest.find('/'), rest.size());
    const std::string_view name = rest.substr(0, end);
    rest.remove_prefix(std::min(end + 1, rest.size()));
    if (name.empty() || name == ".") continue;
    // What is above `path` covers it when it was replaced or vanished; then `path` itself is what changed.
    if (node->changed > since) return collection.add(std::string(path), node->changed);
    const auto child = node->children.find(name);
    if (child == node->children.end()) return;
    node = child->second.get();
    at.append(1, '/').append(name);
  }
  collection.addFrom(*node, at);
}

}  // namespace kel::platform
