#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "platform/linux/conduit/endpoint_socket.h"

namespace kel::platform {

/// The sockets that the service launcher passed to this process, in consecutive descriptors.
struct LauncherSockets {
  int first = 3;
  int count = 0;
  std::optional<std::string> names;  ///< separated by colons
};

/// Reads LISTEN_PID, LISTEN_FDS and LISTEN_FDNAMES and removes them from the environment; no sockets when
/// they are absent, malformed or meant for another process. Before other threads use the environment.
LauncherSockets takeLauncherSockets();

/// The one of `sockets` that listens for Unix stream connections and, where names were passed, bears `name`;
/// made non-blocking. All of them are set to close on exec.
std::optional<EndpointSocket> findLauncherSocket(const LauncherSockets& sockets, std::string_view name);

}  // namespace kel::platform
