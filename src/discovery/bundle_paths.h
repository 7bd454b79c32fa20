#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "platform/platform.h"

namespace kel {

/// The paths of applications, in the registry's order.
struct RegistryPaths {
  std::vector<std::string> paths;
  bool isWhole = true;  ///< false when some could not be found out about for the moment
};

/// The registered applications that provide services. Any thread; may take as long as reading every
/// information dictionary takes.
RegistryPaths service_providing_paths(platform::Platform& platform);

/// What to watch so that changes in any of `paths` are seen: a directory in place of three or more paths in
/// it, and nothing that lies under something else that is watched. In no particular order.
std::vector<std::string> paths_to_observe(const std::vector<std::string>& paths);

/// `path` without its last component, ending in "/".
std::string parent_directory(std::string_view path);

}  // namespace kel
