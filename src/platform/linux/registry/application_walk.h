#pragma once

#include <string>
#include <vector>

namespace kel::platform {

struct FoundApplication {
  std::string path;
  bool isLink = false;  ///< to the application's directory
};

/// What lies below one application directory.
struct ApplicationWalk {
  std::vector<FoundApplication> applications;  ///< sorted by path
  std::vector<std::string> deadLinks;          ///< named like an application, but leading to no directory
  bool reachedLimit = false;                   ///< too many or too deep folders
  bool incomplete = false;                     ///< a limit or an error may hide applications
  bool isTransient = false;                    ///< it is an error that may pass by itself
};

/// Lists the plain folders at and below `root`; no application is opened.
ApplicationWalk walkApplications(const std::string& root);

}  // namespace kel::platform
