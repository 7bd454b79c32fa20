#pragma once

#include <optional>
#include <string>
#include <vector>

#include "platform/file_system.h"
#include "platform/system_log.h"

namespace kel::platform {

/// Files and directories of the machine. Stateless, any thread. Borrows `log`, which outlives it.
///
/// A file is opened before it is looked at, and never in a way that waits, so that what a path leads to
/// cannot be exchanged between the check and the use. Errors are "PATH: reason".
class LinuxFileSystem final : public FileSystem {
 public:
  explicit LinuxFileSystem(SystemLog& log) : log_(log) {}

  DirectoryReading listDirectory(const std::string& directory) override;

  /// Symbolic links are followed: a dangling one does not exist.
  bool exists(const std::string& path) override;

  /// A file that grows past `largest` while it is read is refused like one that was too large before.
  FileReading read(const std::string& path, std::size_t largest) override;

  /// The file gets mode 0600, directories made on the way 0700. Returns when contents and name are on the
  /// disk. A failure leaves the old file and no temporary one.
  std::optional<std::string> writeAtomically(const std::string& path, BytesView bytes) override;

  /// A new file gets mode 0600. Only regular files are written to. A failure may leave a part.
  std::optional<std::string> writePlainly(const std::string& path, BytesView bytes) override;

  bool remove(const std::string& path) override;

 private:
  SystemLog& log_;
};

}  // namespace kel::platform
