#pragma once

#include <optional>
#include <string>

#include "platform/file_system.h"
#include "platform/preferences.h"

namespace kel::platform {

/// Preferences in property-list files, one per domain: what programs wrote (below the state directory) before
/// what the user set down (below the configuration directory). Any thread. Borrows `files`, which outlives
/// it.
class LinuxPreferences final : public Preferences {
 public:
  /// An absent directory has no preferences.
  LinuxPreferences(FileSystem& files, std::optional<std::string> stateDirectory,
                   std::optional<std::string> configurationDirectory)
      : files_(files),
        stateDirectory_(std::move(stateDirectory)),
        configurationDirectory_(std::move(configurationDirectory)) {}

  std::optional<PropertyListValue> value(std::string_view domain, std::string_view key) override;

 private:
  FileSystem& files_;
  const std::optional<std::string> stateDirectory_;
  const std::optional<std::string> configurationDirectory_;
};

}  // namespace kel::platform
