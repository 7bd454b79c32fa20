#pragma once

#include <cstdint>
#include <optional>
#include <string>

namespace kel::platform {

/// A number read from the system, or the error number and its text.
struct SystemReading {
  std::optional<std::int64_t> value;
  int errorNumber = 0;
  std::string errorText;
};

/// Facts about this system, session and process. Any thread.
class SystemFacts {
 public:
  virtual ~SystemFacts() = default;

  /// What the system and this program were built as; "<unknown version>" stands in for a part that cannot be
  /// read.
  virtual std::string buildVersion() = 0;

  /// An integer that stays the same for one boot of the machine and differs between boots.
  virtual SystemReading bootTime() = 0;

  /// The login session of the process, a signed 32-bit value.
  virtual SystemReading auditSession() = 0;

  virtual std::uint32_t realUserID() = 0;
  virtual std::uint32_t random32() = 0;

  /// An environment variable; absent when it is not set.
  virtual std::optional<std::string> environmentVariable(const std::string& name) = 0;
};

}  // namespace kel::platform
