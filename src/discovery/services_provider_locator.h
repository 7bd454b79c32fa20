#pragma once

#include <set>
#include <string>

#include "platform/file_system.h"
#include "platform/system_log.h"

namespace kel {

/// Scans one explicit service directory and remembers the paths of the entries in it, as candidate bundles,
/// until it is told that the directory may have changed.
///
/// Not locked: a locator is used by one thread at a time. Borrows the file system.
class KELServicesProviderLocator {
 public:
  /// A locator that knows nothing yet.
  KELServicesProviderLocator(platform::FileSystem& files, platform::SystemLog& log, std::string basePath);

  /// Lists the directory anew unless the remembered listing counts as valid. A directory that cannot be
  /// listed counts as empty, and as listed; one that cannot be listed for the moment keeps its names and is
  /// not valid, and the system log is told once.
  void refreshCache();

  /// The live set of entry paths; the cache file's listing is restored through it.
  std::set<std::string>& paths() { return paths_; }
  const std::set<std::string>& paths() const { return paths_; }

  const std::string& basePath() const { return basePath_; }
  bool directoryContentsCacheIsValid() const { return directoryContentsCacheIsValid_; }
  void setDirectoryContentsCacheIsValid(bool valid) { directoryContentsCacheIsValid_ = valid; }

  /// The directory could not be listed for the moment and is to be looked at again.
  bool isUnsettled() const { return isUnsettled_; }

 private:
  platform::FileSystem& files_;
  platform::SystemLog& log_;
  std::set<std::string> paths_;
  const std::string basePath_;
  bool directoryContentsCacheIsValid_ = false;
  bool isUnsettled_ = false;
};

}  // namespace kel
