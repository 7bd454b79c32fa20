#include "platform/linux/process/linux_sandbox_query.h"

#include "platform/linux/process/linux_peer_process.h"
#include "platform/linux/process/process_confinement.h"

namespace kel::platform {

int LinuxSandboxQuery::check(const PeerProcess& process) {
  const auto* peer = dynamic_cast<const LinuxPeerProcess*>(&process);
  return !peer || isSandboxed(static_cast<pid_t>(peer->processID()), peer->descriptor()) ? 1 : 0;
}

}  // namespace kel::platform
