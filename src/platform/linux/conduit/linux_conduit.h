#pragma once

#include <functional>

#include "platform/clock.h"
#include "platform/conduit.h"
#include "platform/linux/conduit/launcher_sockets.h"
#include "platform/linux/files/runtime_directory.h"
#include "platform/system_log.h"

namespace kel::platform {

/// The user's endpoints as Unix sockets in the runtime directory. `connect` from any thread, the rest while
/// the server starts. Borrows `log` and `clock`, which outlive every listener.
class LinuxConduit final : public Conduit {
 public:
  /// What the conduit is told by its surroundings; each is called when it is needed.
  struct Environment {
    std::function<void()> trackActivity;
    std::function<RuntimeDirectory()> runtimeDirectory = resolveRuntimeDirectory;
    std::function<LauncherSockets()> launcherSockets = takeLauncherSockets;
  };

  LinuxConduit(SystemLog& log, Clock& clock, Environment environment)
      : log_(log), clock_(clock), environment_(std::move(environment)) {}

  /// Reports begin when an endpoint is served: only then is the server ready.
  void trackActivity() override { tracksActivity_ = true; }

  /// With the launcher's socket, where it passed one for `name`; else binds the socket file. Before other
  /// threads use the environment.
  ConduitListening listen(std::string_view name, SerialQueue& queue, ConduitEventHandler handler) override;
  std::shared_ptr<ConduitConnection> connect(std::string_view name, SerialQueue& queue) override;

 private:
  SystemLog& log_;
  Clock& clock_;
  const Environment environment_;
  bool tracksActivity_ = false;
};

}  // namespace kel::platform
