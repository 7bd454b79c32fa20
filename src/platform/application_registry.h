#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace kel::platform {

struct RegisteredApplication {
  std::optional<std::string> path;  ///< of its bundle; absent when its location is no file
};

/// The installed applications. Any thread; may take as long as reading every information dictionary takes.
class ApplicationRegistry {
 public:
  /// Set in the information flags of applications that declare services.
  static constexpr std::uint32_t providesServices = 0x200000;

  virtual ~ApplicationRegistry() = default;

  /// The applications whose information flags, masked with `mask`, equal `value`, in the registry's order.
  virtual std::vector<RegisteredApplication> applications(std::uint32_t mask, std::uint32_t value) = 0;
};

}  // namespace kel::platform
