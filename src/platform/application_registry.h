#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace kel::platform {

struct RegisteredApplication {
  std::optional<std::string> path;  ///< of its bundle; absent when its location is no file
};

/// The registered applications, in the registry's order.
struct RegisteredApplications {
  std::vector<RegisteredApplication> applications;
  bool isWhole = true;  ///< false when some could not be found out about for the moment
};

/// The installed applications. Any thread; may take as long as reading every information dictionary takes.
class ApplicationRegistry {
 public:
  /// Set in the information flags of applications that declare services.
  static constexpr std::uint32_t providesServices = 0x200000;

  virtual ~ApplicationRegistry() = default;

  /// The applications whose information flags, masked with `mask`, equal `value`.
  virtual RegisteredApplications applications(std::uint32_t mask, std::uint32_t value) = 0;
};

}  // namespace kel::platform
