#pragma once

#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/guarded.h"
#include "platform/standard_directories.h"

namespace kel::test {

struct DirectorySettings {
  std::vector<std::string> libraries{"/home/u/Library", "/Library", "/Network/Library", "/System/Library"};
  std::vector<std::string> systemLibraries{"/System/Library"};
  std::vector<std::string> caches{"/home/u/.cache"};
  std::optional<std::string> temporary = "/tmp/u";
  std::string home = "/home/u";
};

/// The standard directories of the user "u", as a test sets them. Any thread.
class InMemoryDirectories : public platform::StandardDirectories {
 public:
  std::vector<std::string> libraryDirectories() override { return settings_.copy().libraries; }
  std::vector<std::string> systemLibraryDirectories() override { return settings_.copy().systemLibraries; }
  std::vector<std::string> cachesDirectories() override { return settings_.copy().caches; }
  std::optional<std::string> temporaryDirectory() override { return settings_.copy().temporary; }
  std::string homeDirectory() override { return settings_.copy().home; }

  void set(DirectorySettings settings) { settings_.set(std::move(settings)); }

 private:
  platform::Guarded<DirectorySettings> settings_;
};

}  // namespace kel::test
