#pragma once

#include <string_view>

namespace kel::platform {

/// The system log. Any thread; never blocks. Control characters are escaped and overlong texts cut.
class SystemLog {
 public:
  virtual ~SystemLog() = default;
  virtual void write(std::string_view message) = 0;
};

}  // namespace kel::platform
