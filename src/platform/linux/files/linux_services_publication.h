#pragma once

#include <optional>
#include <string>

#include "platform/file_system.h"
#include "platform/services_publication.h"
#include "platform/system_log.h"

namespace kel::platform {

/// Publishes the services in their preferences domain, whose other keys stay. Readers see the old file or the
/// new. One call at a time. Borrows `files` and `log`, which outlive it.
class LinuxServicesPublication final : public ServicesPublication {
 public:
  LinuxServicesPublication(FileSystem& files, SystemLog& log, std::optional<std::string> stateDirectory)
      : files_(files), log_(log), stateDirectory_(std::move(stateDirectory)) {}

  void publish(const PropertyListValue& publication) override;

 private:
  FileSystem& files_;
  SystemLog& log_;
  const std::optional<std::string> stateDirectory_;
};

}  // namespace kel::platform
