#include "platform/linux/journal/journal_tree.h"

#include <algorithm>
#include <utility>

#include "property_lists/unicode.h"

namespace kel::platform {

namespace {

/// Tells the events at and below one node.
class EventCollection {
 public:
  EventCollection(EventID since, std::vector<JournalEvent>& events) : since_(since), events_(events) {}

  /// `path` is the node's, without a trailing "/"; it is left as it was.
  void addFrom(const JournalNode& node, std::string& path) {
    if (node.latest <= since_) return;
    if (node.changed > since_) {
      // With the trailing "/" the event covers all that is below, and no neighbour of a longer name.
      const bool coversAll = node.record.leadsToDirectory() || !node.parent;
      add(coversAll ? path + "/" : path, node.changed);
      if (coversAll || node.isGone) return;
    }
    if (!node.directory) return;
    bool namesChanged = node.directory->listed > since_;
    const std::size_t length = path.size();
    for (const auto& [name, child] : node.directory->children) {
      if (child->latest <= since_) continue;
      if (!isValidUTF8(name)) {
        namesChanged = true;
        continue;
      }
      path.append(1, '/').append(name);
      addFrom(*child, path);
      path.resize(length);
    }
    if (namesChanged) add(path + "/.", node.latest);
  }

  void add(std::string path, EventID id) { events_.push_back({std::move(path), 0, id}); }

 private:
  const EventID since_;
  std::vector<JournalEvent>& events_;
};

}  // namespace

JournalNode* outermostLink(JournalNode& node) {
  JournalNode* link = nullptr;
  for (JournalNode* at = &node; at; at = at->parent) {
    if (at->record.isLink()) link = at;
  }
  return link;
}

JournalTree::JournalTree(WatchedRoot watchedRoot) : watchedRoot_(std::move(watchedRoot)) {
  root_.tree = this;
  root_.record.status.kind = EntryKind::Directory;
  root_.directory = std::make_unique<JournalDirectory>();
}

std::string JournalTree::pathOf(const JournalNode& node) const {
  std::vector<std::string_view> names;
  for (const JournalNode* at = &node; at->parent; at = at->parent) names.push_back(at->name);
  std::string path = watchedRoot_.path.substr(0, watchedRoot_.path.size() - 1);
  for (auto name = names.rbegin(); name != names.rend(); ++name) path.append(1, '/').append(*name);
  return path;
}

JournalNode& JournalTree::add(JournalNode& directory, std::string_view name, EntryRecord record) {
  auto& children = directory.directory->children;
  auto place = children.find(name);
  if (place == children.end()) {
    place = children.emplace(name, std::make_unique<JournalNode>()).first;
    place->second->tree = this;
    place->second->parent = &directory;
    place->second->name = place->first;
    ++nodeCount;
  }
  JournalNode& node = *place->second;
  if (std::exchange(node.isGone, false)) --vanishedCount;
  if (record.leadsToDirectory() && !node.directory) node.directory = std::make_unique<JournalDirectory>();
  node.record = std::move(record);
  return node;
}

void JournalTree::bury(JournalNode& node, EventID id) {
  clear(node);
  node.directory.reset();
  if (!std::exchange(node.isGone, true)) ++vanishedCount;
  markChanged(node, id);
}

void JournalTree::clear(JournalNode& node) {
  if (!node.directory) return;
  for (const auto& [name, child] : node.directory->children) {
    clear(*child);
    if (child->isGone) --vanishedCount;
    --nodeCount;
  }
  node.directory->children.clear();
}

void JournalTree::forgetVanished(EventID newHorizon) {
  forgetVanishedBelow(root_);
  vanishedCount = 0;
  forgetBefore(newHorizon);
}

void JournalTree::forgetBefore(EventID newHorizon) {
  if (horizon != noHorizon) horizon = std::max(horizon, newHorizon);
}

void JournalTree::forgetVanishedBelow(JournalNode& node) {
  if (!node.directory) return;
  nodeCount -=
      std::erase_if(node.directory->children, [](const auto& child) { return child.second->isGone; });
  for (const auto& [name, child] : node.directory->children) forgetVanishedBelow(*child);
}

void JournalTree::markChanged(JournalNode& node, EventID id) {
  node.changed = id;
  for (JournalNode* at = &node; at && at->latest < id; at = at->parent) at->latest = id;
}

void JournalTree::markListed(JournalNode& node, EventID id) {
  node.directory->listed = id;
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
    if (!node->directory) return;
    const auto child = node->directory->children.find(name);
    if (child == node->directory->children.end()) return;
    node = child->second.get();
    at.append(1, '/').append(name);
  }
  collection.addFrom(*node, at);
}

}  // namespace kel::platform
