#include "platform/linux/conduit/linux_conduit.h"

#include <utility>

#include "platform/linux/conduit/conduit_client_connection.h"
#include "platform/linux/conduit/conduit_listener.h"
#include "platform/linux/conduit/endpoint_socket.h"

namespace kel::platform {

namespace {

std::string socketPath(const std::string& directory, std::string_view name) {
  return directory + "/" + std::string(name);
}

}  // namespace

ConduitListening LinuxConduit::listen(std::string_view name, SerialQueue& queue,
                                      ConduitEventHandler handler) {
  const ConduitServerContext context{queue, clock_, log_};
  ConduitListening listening;
  const LauncherSockets passed = environment_.launcherSockets();
  std::optional<EndpointSocket> socket = findLauncherSocket(passed, name);
  if (!socket) {
    // Told, because who connects to the launcher's socket waits in vain while this server has one of its own.
    if (passed.count > 0) {
      log_.write("conduit: none of the launcher's sockets listens for " + std::string(name));
    }
    const RuntimeDirectory directory = environment_.runtimeDirectory();
    if (!directory.path) {
      listening.error = directory.error;
      return listening;
    }
    EndpointBinding binding = bindEndpoint(socketPath(*directory.path, name));
    if (!binding.socket) {
      listening.servedElsewhere = binding.servedElsewhere;
      listening.error = std::move(binding.error);
      return listening;
    }
    socket.emplace(std::move(*binding.socket));
  }
  listening.listener =
      std::make_unique<LinuxConduitListener>(context, std::move(*socket), std::move(handler));
  if (tracksActivity_) environment_.trackActivity();
  return listening;
}

std::shared_ptr<ConduitConnection> LinuxConduit::connect(std::string_view name, SerialQueue& queue) {
  const RuntimeDirectory directory = environment_.runtimeDirectory();
  return std::make_shared<ConduitClientConnection>(
      directory.path ? socketPath(*directory.path, name) : std::string(), queue);
}

}  // namespace kel::platform
