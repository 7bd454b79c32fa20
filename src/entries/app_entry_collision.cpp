#include <algorithm>

#include "common/common.h"
#include "entries/app_entry.h"
#include "property_lists/unicode.h"

namespace kel {

namespace {

std::vector<std::string> makeServiceDirectoryPrecedence(platform::StandardDirectories& directories) {
  std::vector<std::string> result{"/System/Library/Services/",
                                  "/Library/Services/",
                                  platform::joinPath(directories.homeDirectory(), "Library/Services/"),
                                  "/Applications/",
                                  "/OrvexInternal/Library/Services/",
                                  "/OrvexInternal/Applications/"};
  result.reserve(16);
  for (std::string& directory : explicit_service_directories(directories)) {
    if (std::find(result.begin(), result.end(), directory) == result.end())
      result.push_back(std::move(directory));
  }
  return result;
}

/// The position of the first directory that `path` begins with, or the number of directories.
std::ptrdiff_t precedence(const std::vector<std::string>& directories, const std::string& path) {
  const auto found = std::find_if(directories.begin(), directories.end(),
                                  [&](const std::string& directory) { return path.starts_with(directory); });
  return found - directories.begin();
}

struct Preference {
  bool first = false;  ///< the first of the two paths is preferred
  const char* reason = "";
};

Preference preferredPath(const std::vector<std::string>& directories, const std::string& first,
                         const std::string& second) {
  const std::ptrdiff_t firstPosition = precedence(directories, first);
  const std::ptrdiff_t secondPosition = precedence(directories, second);
  if (firstPosition != secondPosition) return {firstPosition < secondPosition, "directory precedence"};
  const bool firstIsElsewhere = first.starts_with("/Volumes/");
  if (firstIsElsewhere != second.starts_with("/Volumes/")) return {!firstIsElsewhere, "boot volume"};
  // Last of all the path that is nearer to the root, counted as the platform counts characters.
  return {platform::utf16Length(first) <= platform::utf16Length(second), "path length"};
}

}  // namespace

const std::vector<std::string>& service_directory_precedence(platform::Platform& platform) {
  return platform.constants.serviceDirectoryPrecedence.get(
      [&] { return makeServiceDirectoryPrecedence(platform.directories); });
}

bool KELAppEntry::shouldTakePriorityOverEntry(const KELAppEntry& other) const {
  const Preference preference =
      preferredPath(service_directory_precedence(platform_), bundlePath(), other.bundlePath());
  send_debug_line([&] {
    const std::string& winner = preference.first ? bundlePath() : other.bundlePath();
    const std::string& loser = preference.first ? other.bundlePath() : bundlePath();
    return "Collision resolution: preferring " + winner + " to " + loser + " due to " + preference.reason;
  });
  return preference.first;
}

}  // namespace kel
