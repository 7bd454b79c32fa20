#pragma once

#include <optional>
#include <string_view>
#include <sys/socket.h>
#include <sys/un.h>

namespace kel::platform {

/// The address of a Unix socket.
struct UnixAddress {
  sockaddr_un address{};
  socklen_t length = 0;

  const sockaddr* get() const { return reinterpret_cast<const sockaddr*>(&address); }
};

/// The address named by an absolute path, or by "@" and an abstract name; absent for anything else and for
/// names that are too long.
std::optional<UnixAddress> unixAddress(std::string_view name);

}  // namespace kel::platform
