#pragma once

#include <optional>
#include <string>
#include <vector>

#include "platform/standard_directories.h"

namespace kel::test {

// What lies in these directories.
inline const std::string cachePath = "/home/u/.cache/com.orvex.qvservicescache.plist";
inline const std::string restrictionsPath =
    "/System/Library/CoreAgents/com.orvex.QVServicesRestrictions.plist";

/// The standard directories of the user "u"; a test changes them before anything reads them.
class InMemoryDirectories : public platform::StandardDirectories {
 public:
  std::vector<std::string> libraryDirectories() override {
    return {"/home/u/Library", "/Library", "/Network/Library", "/System/Library"};
  }
  std::vector<std::string> systemLibraryDirectories() override { return systemLibraries; }
  std::vector<std::string> cachesDirectories() override { return {"/home/u/.cache"}; }
  std::optional<std::string> temporaryDirectory() override { return temporary; }
  std::string homeDirectory() override { return "/home/u"; }

  std::vector<std::string> systemLibraries{"/System/Library"};
  std::optional<std::string> temporary = "/tmp/u";
};

}  // namespace kel::test
