#pragma once

#include <map>
#include <string>

#include "platform/system_facts.h"

namespace kel::platform {

/// Facts from the kernel, the system's files and the environment. Any thread.
class LinuxSystemFacts final : public SystemFacts {
 public:
  /// The environment is copied here, so that a later change of it meets no reader. `root` goes before the
  /// paths of the system's files.
  explicit LinuxSystemFacts(std::string root = {});

  /// For example "debian 12 (kel 0.1.0, cache format 1)". The program's part makes an upgrade discard what
  /// another version cached.
  std::string buildVersion() override;

  /// Made from the kernel's boot identifier: the second of the boot moves when the clock is corrected.
  SystemReading bootTime() override;

  /// The kernel's audit session; -1 for a process outside any.
  SystemReading auditSession() override;

  std::uint32_t realUserID() override;
  std::uint32_t random32() override;

  /// As the environment was when this object was made.
  std::optional<std::string> environmentVariable(const std::string& name) override;

 private:
  const std::string root_;
  std::map<std::string, std::string> environment_;
};

}  // namespace kel::platform
