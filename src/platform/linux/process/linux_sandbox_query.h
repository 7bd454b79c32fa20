#pragma once

#include "platform/sandbox_query.h"

namespace kel::platform {

/// The sandbox query, from what the kernel tells about a process: its root and user namespace, its control
/// group, its security label and the information file of a sandboxed application runtime. Any thread.
class LinuxSandboxQuery final : public SandboxQuery {
 public:
  /// Never fails: every error and doubt, and a process that has ended by the end of the question, gives 1.
  int check(const PeerProcess& process) override;
};

}  // namespace kel::platform
