#pragma once

#include <optional>
#include <string>
#include <vector>

#include "platform/standard_directories.h"
#include "platform/system_facts.h"

namespace kel::platform {

/// The well-known directories, moved by HOME and the XDG variables (relative values of which are ignored).
/// Any thread. Borrows `facts`, which outlives it.
///
/// A directory of the user's that exists but belongs to someone else is refused. None is made here but the
/// private temporary one.
class LinuxStandardDirectories final : public StandardDirectories {
 public:
  /// `runtimeDirectory` is the user's own directory for this session, absent when there is none.
  LinuxStandardDirectories(SystemFacts& facts, std::optional<std::string> runtimeDirectory)
      : facts_(facts), runtimeDirectory_(std::move(runtimeDirectory)) {}

  std::vector<std::string> libraryDirectories() override;
  std::vector<std::string> systemLibraryDirectories() override;
  std::vector<std::string> cachesDirectories() override;

  /// TMPDIR when nobody but the user can put files under the names used there, else a private directory below
  /// the runtime directory, made when it is missing.
  std::optional<std::string> temporaryDirectory() override;

  /// HOME, else what the user database says, else "/" (the only result that ends in a "/").
  std::string homeDirectory() override;

  /// Where programs keep what they write for themselves, and where the user keeps settings; absent when
  /// refused.
  std::optional<std::string> stateDirectory();
  std::optional<std::string> configurationDirectory();

 private:
  std::optional<std::string> absoluteVariable(const std::string& name);
  std::optional<std::string> userDirectory(const std::string& variable, std::string_view belowHome);

  SystemFacts& facts_;
  const std::optional<std::string> runtimeDirectory_;
};

}  // namespace kel::platform
