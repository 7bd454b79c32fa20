#include "discovery/bundle_paths.h"

#include <unordered_map>
#include <unordered_set>
#include <utility>

#include "common/common.h"
#include "common/path_set.h"

namespace kel {

RegistryPaths service_providing_paths(platform::Platform& platform) {
  constexpr std::uint32_t mask = platform::ApplicationRegistry::providesServices;
  const platform::RegisteredApplications registered = platform.applications.applications(mask, mask);
  std::vector<std::string> paths =
      map_array(registered.applications,
                [](const platform::RegisteredApplication& application) { return application.path; });
  send_debug_line([&] { return "Service providing paths:\n\t" + join(paths, "\n\t"); });
  return {std::move(paths), registered.isWhole};
}

std::string parent_directory(std::string_view path) {
  while (path.size() > 1 && path.ends_with('/')) path.remove_suffix(1);
  path = path.substr(0, path.rfind('/') + 1);
  return path.empty() ? "/" : std::string(path);
}

std::vector<std::string> paths_to_observe(const std::vector<std::string>& paths) {
  // Around fewer neighbours a directory may hold much that nobody asks about. From three on, one question
  // about it is cheaper than one about each.
  constexpr std::size_t fewestToShareTheirParent = 3;
  std::unordered_map<std::string, std::size_t> countOfParent;
  for (const std::string& path : paths) ++countOfParent[parent_directory(path)];

  std::unordered_set<std::string> chosen;
  for (const std::string& path : paths) {
    std::string parent = parent_directory(path);
    chosen.insert(countOfParent[parent] >= fewestToShareTheirParent ? std::move(parent) : path);
  }

  // An ancestor ends in "/", so an element has one exactly when a shorter element that ends in "/" is its
  // prefix.
  PathSet possibleAncestors;
  for (const std::string& path : chosen) {
    if (path.ends_with('/')) possibleAncestors.insert(path);
  }
  std::vector<std::string> result;
  for (const std::string& path : chosen) {
    const std::string* ancestor = possibleAncestors.shortestPrefixOf(path);
    if (!ancestor || *ancestor == path) result.push_back(path);
  }
  return result;
}

}  // namespace kel
