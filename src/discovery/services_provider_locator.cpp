#include "discovery/services_provider_locator.h"

#include <utility>
#include <vector>

#include "common/debug_sink.h"

namespace kel {

KELServicesProviderLocator::KELServicesProviderLocator(platform::FileSystem& files, std::string basePath)
    : files_(files), basePath_(std::move(basePath)) {}

void KELServicesProviderLocator::refreshCache() {
  if (directoryContentsCacheIsValid_) {
    send_debug_line([&] { return "Cache valid for directory " + basePath_; });
    return;
  }
  send_debug_line([&] { return "Scanning directory: " + basePath_; });
  paths_.clear();
  for (const std::string& name : files_.listDirectory(basePath_).value_or(std::vector<std::string>())) {
    if (!name.empty() && !name.starts_with('.')) paths_.insert(platform::joinPath(basePath_, name));
  }
  // Even when it could not be listed: a missing directory is not tried again until the journal tells of it.
  directoryContentsCacheIsValid_ = true;
}

}  // namespace kel
