#pragma once

#include <cstddef>
#include <map>
#include <optional>
#include <set>
#include <stdexcept>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/file_system.h"
#include "platform/guarded.h"

namespace kel::test {

/// A tree of files and directories in memory, with the user's temporary directory from the start. Adding a
/// file makes the directories above it; a trailing "/" of a path does not count. Any thread.
class InMemoryFileSystem : public platform::FileSystem {
 public:
  platform::DirectoryReading listDirectory(const std::string& directory) override {
    return state_.with([&](State& state) -> platform::DirectoryReading {
      const Node* node = state.use(directory);
      if (state.failsFor(directory)) return {std::nullopt, directory + ": Input/output error", true};
      if (!node || *node) return {std::nullopt, directory + ": no directory", false};
      std::vector<std::string> names;
      for (const auto& [path, child] : state.nodes) {
        const std::size_t slash = path.rfind('/');
        if (path.substr(0, slash) == normalised(directory)) names.push_back(path.substr(slash + 1));
      }
      return {std::move(names), {}, false};
    });
  }
  bool exists(const std::string& path) override {
    return state_.with([&](State& state) { return state.use(path) != nullptr; });
  }
  platform::FileReading read(const std::string& path, std::size_t largest) override {
    return state_.with([&](State& state) -> platform::FileReading {
      const Node* node = state.use(path);
      if (state.failsFor(path)) return {std::nullopt, path + ": Input/output error", true};
      if (!node) return {std::nullopt, path + ": No such file or directory", false};
      if (!*node) return {std::nullopt, path + ": not a regular file", false};
      if ((*node)->size() > largest) return {std::nullopt, path + ": too large", false};
      return {*node, {}, false};
    });
  }
  std::optional<std::string> writeAtomically(const std::string& path, platform::BytesView bytes) override {
    return state_.with([&](State& state) { return state.write(path, bytes, true); });
  }
  std::optional<std::string> writePlainly(const std::string& path, platform::BytesView bytes) override {
    return state_.with([&](State& state) { return state.write(path, bytes, false); });
  }
  bool remove(const std::string& path) override {
    return state_.with([&](State& state) {
      const Node* node = state.use(path);
      return node && *node && state.nodes.erase(normalised(path)) == 1;
    });
  }

  // Arranging the tree and looking at it; none of these counts as a use.
  void addFile(const std::string& path, platform::Bytes bytes) {
    state_.with([&](State& state) {
      if (const auto error = state.put(path, std::move(bytes), true)) throw std::logic_error(path + *error);
    });
  }
  void addText(const std::string& path, std::string_view text) {
    addFile(path, platform::Bytes(text.begin(), text.end()));
  }
  void addPropertyList(const std::string& path, const platform::PropertyListValue& value) {
    addFile(path, platform::writeBinaryPropertyList(value).bytes.value());
  }
  void removeTree(const std::string& path) {
    state_.with([&](State& state) {
      std::erase_if(state.nodes, [prefix = path + "/"](const auto& node) {
        return (node.first + "/").starts_with(prefix);
      });
    });
  }
  bool isDirectory(const std::string& path) {
    return state_.with([&](State& state) { return state.find(path) && !*state.find(path); });
  }
  bool isFile(const std::string& path) { return contents(path).has_value(); }
  std::optional<platform::Bytes> contents(const std::string& path) {
    return state_.with([&](State& state) { return state.find(path) ? *state.find(path) : std::nullopt; });
  }

  /// How often `path` was listed, tested, read, written or removed, from the start or the last forgetting.
  std::size_t uses(const std::string& path) {
    return state_.with([&](State& state) { return state.uses[normalised(path)]; });
  }
  void forgetUses() {
    state_.with([](State& state) { state.uses.clear(); });
  }

  /// Reading or listing these paths fails, in a way that may pass, until the set is another.
  void setFailing(std::set<std::string> paths) {
    state_.with([&](State& state) { state.failing = std::move(paths); });
  }

  /// The next write fails with `error` and changes nothing.
  void failNextWrite(std::string error) {
    state_.with([&](State& state) { state.nextWriteError = std::move(error); });
  }

 private:
  using Node = std::optional<platform::Bytes>;  ///< absent for a directory

  struct State {
    std::map<std::string, Node> nodes{{"/tmp", {}}, {"/tmp/u", {}}};  ///< by normalised path
    std::map<std::string, std::size_t> uses;
    std::optional<std::string> nextWriteError;
    std::set<std::string> failing;

    bool failsFor(const std::string& path) const { return failing.contains(normalised(path)); }

    const Node* find(const std::string& path) const {
      const auto found = nodes.find(normalised(path));
      return found == nodes.end() ? nullptr : &found->second;
    }
    const Node* use(const std::string& path) {
      ++uses[normalised(path)];
      return find(path);
    }
    std::optional<std::string> write(const std::string& path, platform::BytesView bytes, bool makesParents) {
      use(path);
      if (nextWriteError) return std::exchange(nextWriteError, std::nullopt);
      return put(path, platform::Bytes(bytes.begin(), bytes.end()), makesParents);
    }
    std::optional<std::string> put(const std::string& path, Node node, bool makesParents) {
      const std::string own = normalised(path), parent = own.substr(0, own.rfind('/'));
      if (find(own) && !*find(own)) return "Is a directory";
      if (find(parent) && *find(parent)) return "Not a directory";
      if (!find(parent) && !parent.empty()) {
        if (!makesParents) return "No such file or directory";
        if (const auto error = put(parent, std::nullopt, true)) return error;
      }
      nodes[own] = std::move(node);
      return std::nullopt;
    }
  };

  static std::string normalised(std::string path) {
    while (path.ends_with('/')) path.pop_back();
    return path;
  }

  platform::Guarded<State> state_;
};

}  // namespace kel::test
