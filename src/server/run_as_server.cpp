#include "server/run_as_server.h"

#include <utility>

#include "common/common.h"
#include "property_lists/property_list.h"

namespace kel {

using platform::ConduitConnection;
using platform::ConduitError;
using platform::ConduitEvent;
using platform::ConduitMessage;

namespace {

void handleRequest(platform::Platform& platform, KELServer& server,
                   const std::shared_ptr<ConduitMessage>& message, const platform::PeerProcess* peer,
                   bool sandboxed) {
  static constexpr const char* routine = "accept_conduit_connection";
  const platform::PropertyListDictionary& request = *message->contents().asDictionary();
  const KELCommand command = classify_request(request);
  if (command == KELCommand::KELCommandInvalid) {
    platform.log.write(std::string(routine) +
                       ": unknown Conduit message: " + platform::describeBriefly(message->contents()) + "\n");
    return;
  }
  if (sandboxed && refused_to_sandboxed(command)) {
    platform.log.write(std::string(routine) + ": refusing request from sandboxed app " +
                       std::to_string(peer ? peer->processID() : 0) + ": " +
                       platform::describeBriefly(message->contents()) + "\n");
    return;
  }
  if (command == KELCommand::KELCommandLocalizations && names_too_many_localizations(request)) {
    platform.log.write(std::string(routine) + ": refusing request for more than " +
                       std::to_string(mostRequestedLocalizations) + " localizations\n");
    return;
  }
  server.conduitQueue().assertCurrent();
  server.performCommand(command, message, wants_debug(request) && !sandboxed, sandboxed);
}

platform::ConduitListening listen(platform::Platform& platform, KELServer& server) {
  return platform.conduit.listen(endpointName, server.conduitQueue(), [&](const ConduitEvent& event) {
    if (const auto* error = std::get_if<ConduitError>(&event)) {
      platform.log.write("run_as_server: kel message error: " + error->description);
    } else if (const auto* connection = std::get_if<std::shared_ptr<ConduitConnection>>(&event)) {
      accept_conduit_connection(platform, server, *connection);
    } else {
      platform.log.write(unknown_message_type("run_as_server", "event", event) + "\n");
    }
  });
}

void subscribeToLaunchEvents(platform::Platform& platform, KELServer& server) {
  const auto subscribe = [&](const char* stream, void (KELServer::*react)()) {
    platform.launchEvents.setHandler(stream, server.conduitQueue(), [&server, react] { (server.*react)(); });
  };
  namespace streams = platform::launch_streams;
  subscribe(streams::databaseChanges, &KELServer::reactToAppRegistryDatabaseChange);
  subscribe(streams::seedingComplete, &KELServer::reactToAppRegistrySeedingComplete);
  subscribe(streams::directoryChanges, &KELServer::reactToVigilChange);
}

}  // namespace

int run_as_server(platform::Platform& platform) {
  platform.conduit.trackActivity();
  platform.journal.watch(explicit_service_directories(platform.directories));
  KELServer server(platform);
  // Before the endpoint is there: whoever can reach the server can also end it with success.
  platform.process.onTermination([&platform] { platform.process.exitNow(0); });
  platform::ConduitListening listening;
  // On the queue itself: the streams' first events, queued here, run before the first request is read.
  server.conduitQueue().sync([&] {
    listening = listen(platform, server);
    if (listening.listener) subscribeToLaunchEvents(platform, server);
  });
  if (!listening.listener) {
    platform.log.write("run_as_server: kel message error: " + listening.error);
    return listening.servedElsewhere ? 0 : 1;
  }
  platform.process.runMainLoop();
  server.conduitQueue().sync([&] { listening.listener.reset(); });
  return 0;
}

void accept_conduit_connection(platform::Platform& platform, KELServer& server,
                               const std::shared_ptr<ConduitConnection>& connection) {
  const std::shared_ptr<const platform::PeerProcess> peer = connection->peer();
  const bool sandboxed = peer && platform.sandbox.check(*peer) > 0;
  connection->setEventHandler([&platform, &server, peer, sandboxed](const ConduitEvent& event) {
    static constexpr const char* routine = "accept_conduit_connection";
    const auto* message = std::get_if<std::shared_ptr<ConduitMessage>>(&event);
    if (const auto* error = std::get_if<ConduitError>(&event)) {
      if (error->kind == ConduitError::Kind::ConnectionInvalid) return;
      platform.log.write(std::string(routine) + " kel message error: " + error->description);
    } else if (message && (*message)->contents().asDictionary()) {
      handleRequest(platform, server, *message, peer.get(), sandboxed);
    } else {
      platform.log.write(unknown_message_type(routine, "event", event) + "\n");
    }
  });
  connection->start();
}

}  // namespace kel
