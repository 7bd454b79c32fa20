#pragma once

#include "platform/conduit.h"

namespace kel::platform {

/// Tells whether a process runs in a sandbox. Any thread; may read a few files.
class SandboxQuery {
 public:
  virtual ~SandboxQuery() = default;

  /// Greater than zero: sandboxed. Zero: not. Less than zero: the question failed.
  virtual int check(const PeerProcess& process) = 0;
};

}  // namespace kel::platform
