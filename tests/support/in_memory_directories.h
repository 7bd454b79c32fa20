#pragma once

#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/standard_directories.h"

namespace kel::test {

struct DirectorySettings {
  std::vector<std::string> libraries{"/home/u/Library", "/Library", "/Network/Library", "/System/Library"};
  std::vector<std::string> systemLibraries{"/System/Library"};
  std::optional<std::string> temporary = "/tmp/u";
};

/// The standard directories of the user "u"; a test changes them before anything reads them.
class InMemoryDirectories : public platform::StandardDirectories {
 public:
  std::vector<std::string> libraryDirectories() override { return settings_.libraries; }
  std::vector<std::string> systemLibraryDirectories() override { return settings_.systemLibraries; }
  std::vector<std::string> cachesDirectories() override { return {"/home/u/.cache"}; }
  std::optional<std::string> temporaryDirectory() override { return settings_.temporary; }
  std::string homeDirectory() override { return "/home/u"; }

  void set(DirectorySettings settings) { settings_ = std::move(settings); }

 private:
  DirectorySettings settings_;
};

}  // namespace kel::test
