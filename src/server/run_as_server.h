#pragma once

#include <memory>

#include "platform/platform.h"
#include "server/server.h"

namespace kel {

/// Serves the endpoint until the termination signal ends the process. Returns only when the endpoint cannot
/// be served: the exit status is then 0 when another server holds it, else 1.
int run_as_server(platform::Platform& platform);

/// Serves `connection`: classifies its requests, refuses a sandboxed peer what it may not ask for, has the
/// rest performed. On the server's `conduitQueue`; `server` outlives the connection.
void accept_conduit_connection(platform::Platform& platform, KELServer& server,
                               const std::shared_ptr<platform::ConduitConnection>& connection);

}  // namespace kel
