#include "discovery/services_provider_locator.h"

#include <utility>
#include <vector>

#include "common/debug_sink.h"

namespace kel {

KELServicesProviderLocator::KELServicesProviderLocator(platform::FileSystem& files, platform::SystemLog& log,
                                                       std::string basePath)
    : files_(files), log_(log), basePath_(std::move(basePath)) {}

void KELServicesProviderLocator::refreshCache() {
  if (directoryContentsCacheIsValid_) {
    send_debug_line([&] { return "Cache valid for directory " + basePath_; });
    return;
  }
  send_debug_line([&] { return "Scanning directory: " + basePath_; });
  const platform::DirectoryReading listing = files_.listDirectory(basePath_);
  if (listing.isTransient) {
    if (!std::exchange(isUnsettled_, true)) {
      log_.write("Cannot be read for now, trying again: " + listing.error);
    }
    return;
  }
  isUnsettled_ = false;
  paths_.clear();
  for (const std::string& name : listing.names.value_or(std::vector<std::string>())) {
    if (!name.empty() && !name.starts_with('.')) paths_.insert(platform::joinPath(basePath_, name));
  }
  // Even when it could not be listed: a missing directory is not tried again until the journal tells of it.
  directoryContentsCacheIsValid_ = true;
}

}  // namespace kel
