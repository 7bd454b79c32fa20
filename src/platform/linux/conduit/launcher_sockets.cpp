#include "platform/linux/conduit/launcher_sockets.h"

#include <charconv>
#include <cstdlib>
#include <fcntl.h>
#include <sys/socket.h>
#include <unistd.h>
#include <utility>
#include <vector>

namespace kel::platform {

namespace {

constexpr int mostSockets = 1024;

std::optional<std::string> takeVariable(const char* name) {
  const char* value = std::getenv(name);
  std::optional<std::string> result;
  if (value) result = value;
  // A child that inherited it would take our descriptors' numbers for sockets of its own.
  unsetenv(name);
  return result;
}

std::optional<int> wholeNumber(const std::optional<std::string>& text) {
  int number = 0;
  if (!text) return std::nullopt;
  const char* end = text->data() + text->size();
  const auto [parsed, error] = std::from_chars(text->data(), end, number);
  return error == std::errc() && parsed == end ? std::optional(number) : std::nullopt;
}

std::vector<std::string_view> split(std::string_view names) {
  std::vector<std::string_view> result;
  for (;;) {
    const std::size_t colon = names.find(':');
    result.push_back(names.substr(0, colon));
    if (colon == std::string_view::npos) return result;
    names.remove_prefix(colon + 1);
  }
}

bool hasOption(int descriptor, int option, int expected) {
  int value = 0;
  socklen_t length = sizeof value;
  return getsockopt(descriptor, SOL_SOCKET, option, &value, &length) == 0 && value == expected;
}

/// What the launcher is told to pass is the user's to configure, and may be anything.
bool listensForUnixStreams(int descriptor) {
  return hasOption(descriptor, SO_DOMAIN, AF_UNIX) && hasOption(descriptor, SO_TYPE, SOCK_STREAM) &&
         hasOption(descriptor, SO_ACCEPTCONN, 1);
}

}  // namespace

LauncherSockets takeLauncherSockets() {
  const std::optional<int> process = wholeNumber(takeVariable("LISTEN_PID"));
  const std::optional<int> count = wholeNumber(takeVariable("LISTEN_FDS"));
  std::optional<std::string> names = takeVariable("LISTEN_FDNAMES");
  LauncherSockets sockets;
  if (process != getpid() || !count || *count < 0 || *count > mostSockets) return sockets;
  sockets.count = *count;
  sockets.names = std::move(names);
  return sockets;
}

std::optional<EndpointSocket> findLauncherSocket(const LauncherSockets& sockets, std::string_view name) {
  const std::vector<std::string_view> names =
      sockets.names ? split(*sockets.names) : std::vector<std::string_view>{};
  std::optional<EndpointSocket> found;
  for (int i = 0; i < sockets.count; ++i) {
    const int descriptor = sockets.first + i;
    if (fcntl(descriptor, F_SETFD, FD_CLOEXEC) != 0 || found) continue;
    const auto index = static_cast<std::size_t>(i);
    if (sockets.names && (index >= names.size() || names[index] != name)) continue;
    if (!listensForUnixStreams(descriptor)) continue;
    // Another process that waits in the same socket may accept a connection first: accepting must not wait.
    const int flags = fcntl(descriptor, F_GETFL);
    if (flags < 0 || fcntl(descriptor, F_SETFL, flags | O_NONBLOCK) != 0) continue;
    found.emplace(OwnedDescriptor(descriptor));
  }
  return found;
}

}  // namespace kel::platform
