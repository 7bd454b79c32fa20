#pragma once

#include <optional>
#include <string>
#include <vector>

namespace kel::platform {

/// The platform's well-known directories, home directory expanded, without a trailing "/". Any thread.
class StandardDirectories {
 public:
  virtual ~StandardDirectories() = default;

  /// Library directories of all domains: the user's, the machine's, the network's, the system's.
  virtual std::vector<std::string> libraryDirectories() = 0;

  /// Library directories of the system domain; the last one counts.
  virtual std::vector<std::string> systemLibraryDirectories() = 0;

  /// The user's caches directories; the last one counts. Empty when there is none.
  virtual std::vector<std::string> cachesDirectories() = 0;

  /// The user's temporary directory, or absent when none is safe to use.
  virtual std::optional<std::string> temporaryDirectory() = 0;

  virtual std::string homeDirectory() = 0;
};

}  // namespace kel::platform
