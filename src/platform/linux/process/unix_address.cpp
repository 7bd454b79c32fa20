#include "platform/linux/process/unix_address.h"

#include <algorithm>
#include <cstddef>

namespace kel::platform {

std::optional<UnixAddress> unixAddress(std::string_view name) {
  UnixAddress result;
  const bool isAbstract = name.starts_with('@');
  if (!(isAbstract || name.starts_with('/')) || name.size() >= sizeof result.address.sun_path ||
      name.find('\0') != std::string_view::npos) {
    return std::nullopt;
  }
  result.address.sun_family = AF_UNIX;
  std::copy(name.begin(), name.end(), result.address.sun_path);
  if (isAbstract) result.address.sun_path[0] = '\0';
  const std::size_t terminator = isAbstract ? 0 : 1;
  result.length = static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + name.size() + terminator);
  return result;
}

}  // namespace kel::platform
