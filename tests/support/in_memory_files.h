#pragma once

#include <cstddef>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/file_system.h"
#include "platform/guarded.h"

namespace kel::test {

/// What was asked of one path.
struct FileOperationCounts {
  std::size_t listings = 0;
  std::size_t existenceTests = 0;
  std::size_t reads = 0;
  std::size_t writes = 0;
  std::size_t removals = 0;

  bool operator==(const FileOperationCounts&) const = default;
};

/// A tree of files and directories in memory. Adding a file makes the directories above it; a trailing "/" of
/// a path does not count. Any thread.
class InMemoryFileSystem : public platform::FileSystem {
 public:
  std::optional<std::vector<std::string>> listDirectory(const std::string& directory) override;
  bool exists(const std::string& path) override;
  platform::FileReading read(const std::string& path, std::size_t largest) override;
  std::optional<std::string> writeAtomically(const std::string& path, platform::BytesView bytes) override;
  std::optional<std::string> writePlainly(const std::string& path, platform::BytesView bytes) override;
  bool remove(const std::string& path) override;

  // Arranging the tree; none of these is counted.
  void addFile(const std::string& path, platform::Bytes bytes);
  void addText(const std::string& path, std::string_view text);
  void addPropertyList(const std::string& path, const platform::PropertyListValue& value);
  void addDirectory(const std::string& path);
  void removeTree(const std::string& path);

  // Looking at it; not counted either.
  bool isDirectory(const std::string& path) const;
  bool isFile(const std::string& path) const;
  std::optional<platform::Bytes> contents(const std::string& path) const;
  FileOperationCounts counts(const std::string& path) const;
  void resetCounts();

  /// The next write fails with `error` and changes nothing.
  void failNextWrite(std::string error = "No space left on device");

  /// Reading, listing and writing `path` fail until the permission is given back; it still exists.
  void setUnreadable(const std::string& path, bool unreadable = true);

 private:
  struct Node {
    std::optional<platform::Bytes> bytes;  ///< absent for a directory
    bool unreadable = false;
  };
  struct State {
    std::map<std::string, Node> nodes{{"/", {}}};
    std::map<std::string, FileOperationCounts> counts;
    std::optional<std::string> nextWriteError;

    const Node* find(const std::string& normalised) const;
    void makeDirectories(const std::string& normalised);
    void put(const std::string& normalised, platform::Bytes bytes);
    std::optional<std::string> write(const std::string& normalised, platform::BytesView bytes);
  };

  mutable platform::Guarded<State> state_;
};

}  // namespace kel::test
