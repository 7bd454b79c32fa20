#pragma once

#include <string>
#include <vector>

#include "platform/application_registry.h"
#include "platform/file_system.h"
#include "platform/system_log.h"
#include "platform/work_queue.h"

namespace kel::platform {

/// The applications in the application directories: every directory whose name ends in ".app", there and in
/// plain subfolders, and every symbolic link of such a name that leads to a directory. Hidden folders,
/// bundles and other links are not looked into.
///
/// Each query scans anew. Any thread. Borrows everything it is given.
class LinuxApplicationRegistry final : public ApplicationRegistry {
 public:
  /// `roots` are the application directories, in order.
  LinuxApplicationRegistry(FileSystem& files, SystemLog& log, ConcurrentQueue& queue,
                           std::vector<std::string> roots)
      : files_(files), log_(log), queue_(queue), roots_(std::move(roots)) {}

  /// "/System/Applications/", "/Network/Applications/", "/Applications/" and "Applications/" in `home`.
  static std::vector<std::string> applicationDirectories(const std::string& home);

  /// In the order of the roots, then of the paths. Information dictionaries are read in parallel; one that
  /// cannot be read sets no flag.
  std::vector<RegisteredApplication> applications(std::uint32_t mask, std::uint32_t value) override;

 private:
  std::vector<std::string> findApplications();
  std::uint32_t informationFlags(const std::string& application);

  FileSystem& files_;
  SystemLog& log_;
  ConcurrentQueue& queue_;
  const std::vector<std::string> roots_;
};

}  // namespace kel::platform
