#pragma once

#include <set>
#include <string>

#include "platform/file_system.h"

namespace kel {

/// Scans one explicit service directory and remembers the paths of the entries in it, as candidate bundles,
/// until it is told that the directory may have changed.
///
/// Not locked: a locator is used by one thread at a time. Borrows the file system.
class KELServicesProviderLocator {
 public:
  /// A locator that knows nothing yet.
  KELServicesProviderLocator(platform::FileSystem& files, std::string basePath);

  /// Lists the directory anew unless the remembered listing counts as valid. A directory that cannot be
  /// listed counts as empty, and as listed.
  void refreshCache();

  /// The live set of entry paths; the cache file's listing is restored through it.
  std::set<std::string>& paths() { return paths_; }
  const std::set<std::string>& paths() const { return paths_; }

  const std::string& basePath() const { return basePath_; }
  bool directoryContentsCacheIsValid() const { return directoryContentsCacheIsValid_; }
  void setDirectoryContentsCacheIsValid(bool valid) { directoryContentsCacheIsValid_ = valid; }

 private:
  platform::FileSystem& files_;
  std::set<std::string> paths_;
  const std::string basePath_;
  bool directoryContentsCacheIsValid_ = false;
};

}  // namespace kel
