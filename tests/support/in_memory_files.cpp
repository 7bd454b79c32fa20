#include "support/in_memory_files.h"

#include <stdexcept>
#include <utility>

namespace kel::test {

namespace {

std::string normalised(const std::string& path) {
  std::string result;
  for (const char c : path) {
    if (c != '/' || !result.ends_with('/')) result += c;
  }
  if (result.size() > 1 && result.ends_with('/')) result.pop_back();
  return result;
}

std::string parent(const std::string& path) {
  const std::size_t slash = path.rfind('/');
  return slash == 0 || slash == std::string::npos ? "/" : path.substr(0, slash);
}

/// The prefix that every path below the directory `path` has.
std::string below(const std::string& path) { return path == "/" ? path : path + "/"; }

}  // namespace

const InMemoryFileSystem::Node* InMemoryFileSystem::State::find(const std::string& path) const {
  const auto found = nodes.find(path);
  return found == nodes.end() ? nullptr : &found->second;
}

void InMemoryFileSystem::State::makeDirectories(const std::string& path) {
  if (path != "/") makeDirectories(parent(path));
  if (nodes[path].bytes) throw std::logic_error(path + " is a file");
}

void InMemoryFileSystem::State::put(const std::string& path, platform::Bytes bytes) {
  makeDirectories(parent(path));
  nodes[path].bytes = std::move(bytes);
}

std::optional<std::string> InMemoryFileSystem::State::write(const std::string& path,
                                                            platform::BytesView bytes) {
  ++counts[path].writes;
  if (nextWriteError) return std::exchange(nextWriteError, std::nullopt);
  const Node* node = find(path);
  if (node && !node->bytes) return "Is a directory";
  if (node && node->unreadable) return "Permission denied";
  for (std::string above = parent(path); above != "/"; above = parent(above)) {
    const Node* directory = find(above);
    if (directory && directory->bytes) return "Not a directory";
  }
  put(path, platform::Bytes(bytes.begin(), bytes.end()));
  return std::nullopt;
}

std::optional<std::vector<std::string>> InMemoryFileSystem::listDirectory(const std::string& directory) {
  const std::string path = normalised(directory);
  return state_.with([&](State& state) -> std::optional<std::vector<std::string>> {
    ++state.counts[path].listings;
    const Node* node = state.find(path);
    if (!node || node->bytes || node->unreadable) return std::nullopt;
    const std::string prefix = below(path);
    std::vector<std::string> names;
    for (auto at = state.nodes.upper_bound(prefix); at != state.nodes.end(); ++at) {
      if (!at->first.starts_with(prefix)) break;
      std::string name = at->first.substr(prefix.size());
      if (name.find('/') == std::string::npos) names.push_back(std::move(name));
    }
    return names;
  });
}

bool InMemoryFileSystem::exists(const std::string& path) {
  return state_.with([path = normalised(path)](State& state) {
    ++state.counts[path].existenceTests;
    return state.find(path) != nullptr;
  });
}

platform::FileReading InMemoryFileSystem::read(const std::string& path, std::size_t largest) {
  return state_.with([&, path = normalised(path)](State& state) -> platform::FileReading {
    ++state.counts[path].reads;
    const Node* node = state.find(path);
    if (!node) return {std::nullopt, "No such file or directory"};
    if (!node->bytes) return {std::nullopt, "not a regular file"};
    if (node->unreadable) return {std::nullopt, "Permission denied"};
    if (node->bytes->size() > largest) return {std::nullopt, "too large"};
    return {*node->bytes, {}};
  });
}

std::optional<std::string> InMemoryFileSystem::writeAtomically(const std::string& path,
                                                               platform::BytesView bytes) {
  return state_.with([&](State& state) { return state.write(normalised(path), bytes); });
}

std::optional<std::string> InMemoryFileSystem::writePlainly(const std::string& path,
                                                            platform::BytesView bytes) {
  return state_.with([&, path = normalised(path)](State& state) -> std::optional<std::string> {
    if (!state.find(parent(path))) return "No such file or directory";
    return state.write(path, bytes);
  });
}

bool InMemoryFileSystem::remove(const std::string& path) {
  return state_.with([path = normalised(path)](State& state) {
    ++state.counts[path].removals;
    const Node* node = state.find(path);
    return node && node->bytes && state.nodes.erase(path) == 1;
  });
}

void InMemoryFileSystem::addFile(const std::string& path, platform::Bytes bytes) {
  state_.with([&](State& state) { state.put(normalised(path), std::move(bytes)); });
}

void InMemoryFileSystem::addText(const std::string& path, std::string_view text) {
  addFile(path, platform::Bytes(text.begin(), text.end()));
}

void InMemoryFileSystem::addPropertyList(const std::string& path, const platform::PropertyListValue& value) {
  platform::PropertyListWriting writing = platform::writeBinaryPropertyList(value);
  if (!writing.bytes) throw std::invalid_argument(writing.error);
  addFile(path, std::move(*writing.bytes));
}

void InMemoryFileSystem::addDirectory(const std::string& path) {
  state_.with([&](State& state) { state.makeDirectories(normalised(path)); });
}

void InMemoryFileSystem::removeTree(const std::string& path) {
  state_.with([path = normalised(path)](State& state) {
    std::erase_if(state.nodes, [&](const auto& node) {
      return node.first == path || node.first.starts_with(below(path));
    });
  });
}

bool InMemoryFileSystem::isDirectory(const std::string& path) const {
  return state_.with([path = normalised(path)](const State& state) {
    const Node* node = state.find(path);
    return node && !node->bytes;
  });
}

bool InMemoryFileSystem::isFile(const std::string& path) const { return contents(path).has_value(); }

std::optional<platform::Bytes> InMemoryFileSystem::contents(const std::string& path) const {
  return state_.with([path = normalised(path)](const State& state) {
    const Node* node = state.find(path);
    return node ? node->bytes : std::nullopt;
  });
}

FileOperationCounts InMemoryFileSystem::counts(const std::string& path) const {
  return state_.with([path = normalised(path)](const State& state) {
    const auto found = state.counts.find(path);
    return found == state.counts.end() ? FileOperationCounts{} : found->second;
  });
}

void InMemoryFileSystem::resetCounts() {
  state_.with([](State& state) { state.counts.clear(); });
}

void InMemoryFileSystem::failNextWrite(std::string error) {
  state_.with([&](State& state) { state.nextWriteError = std::move(error); });
}

void InMemoryFileSystem::setUnreadable(const std::string& path, bool unreadable) {
  state_.with([&](State& state) { state.nodes.at(normalised(path)).unreadable = unreadable; });
}

}  // namespace kel::test
