#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>

#include "platform/work_queue.h"

namespace kel::platform {

/// The per-user notification service: each name has a 64-bit state, kept between runs, and can be posted. Any
/// thread. Failures are reported once to the system log and absorbed.
class NotificationSeeds {
 public:
  using Token = std::int32_t;

  /// A running observation; none of its calls starts after it was destroyed on its queue.
  class Observation {
   public:
    virtual ~Observation() = default;
  };

  virtual ~NotificationSeeds() = default;

  /// A token for `name`, the same for every call with that name.
  virtual Token registerName(const std::string& name) = 0;

  /// The state of the token's name; 0 when it was never set or cannot be read.
  virtual std::uint64_t state(Token token) = 0;
  virtual void setState(Token token, std::uint64_t state) = 0;

  /// Tells every observer of `name`, in this and in other processes of the user.
  virtual void post(const std::string& name) = 0;

  /// Runs `posted` on `queue` after posts of `name`, once or more for any number of them.
  [[nodiscard]] virtual std::unique_ptr<Observation> observe(const std::string& name, SerialQueue& queue,
                                                             std::function<void()> posted) = 0;
};

}  // namespace kel::platform
