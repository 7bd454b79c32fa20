#pragma once

#include <memory>
#include <string>

#include "platform/bundles.h"
#include "platform/file_system.h"
#include "platform/system_log.h"

namespace kel::platform {

/// Bundles on disk: a directory with "Info.plist" at its top and localized resources below "Resources". Any
/// thread. Borrows `files` and `log`, which outlive it and the bundles it opens.
///
/// Nothing is read before it is asked for, and the information dictionary once per opened bundle. One that is
/// there but cannot be read counts as empty, with a line in the system log.
class LinuxBundles final : public Bundles {
 public:
  LinuxBundles(FileSystem& files, SystemLog& log) : files_(files), log_(log) {}

  std::unique_ptr<Bundle> open(const std::string& path) override;

 private:
  FileSystem& files_;
  SystemLog& log_;
};

}  // namespace kel::platform
