#include "common/common.h"

namespace kel {

bool running_from_launcher(platform::SystemFacts& facts) {
  return facts.environmentVariable("QVRunningFromWarden") == "1";
}

std::optional<std::string> cache_file_path(platform::StandardDirectories& directories) {
  const std::vector<std::string> caches = directories.cachesDirectories();
  if (caches.empty()) return std::nullopt;
  return platform::joinPath(caches.back(), "com.orvex.qvservicescache.plist");
}

std::vector<std::string> explicit_service_directories(platform::StandardDirectories& directories) {
  std::vector<std::string> result{"/OrvexInternal/Applications/"};
  for (const std::string& library : directories.libraryDirectories())
    result.push_back(library + "/Services/");
  result.push_back("/OrvexInternal/Library/Services/");
  return result;
}

std::string join(const std::vector<std::string>& elements, std::string_view separator) {
  std::string result;
  for (const std::string& element : elements) {
    if (&element != &elements.front()) result += separator;
    result += element;
  }
  return result;
}

}  // namespace kel
