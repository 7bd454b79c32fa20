#pragma once

#include "platform/conduit.h"
#include "platform/linux/files/owned_descriptor.h"

namespace kel::platform {

/// The process that connected a socket, held by a process descriptor. Immutable; any thread.
class LinuxPeerProcess : public PeerProcess {
 public:
  /// Takes a `descriptor` that refers to the process, or none.
  LinuxPeerProcess(std::int64_t processID, OwnedDescriptor descriptor)
      : processID_(processID), descriptor_(std::move(descriptor)) {}

  /// The process at the other end of a connected Unix socket. Processes that run as another user are for the
  /// caller to refuse.
  static std::shared_ptr<const LinuxPeerProcess> ofSocket(int socket, std::int64_t processID);

  std::int64_t processID() const override { return processID_; }

  /// A process descriptor (for pidfd_send_signal, poll and the like), valid as long as this object lives; -1
  /// when the process was gone already or none could be had. Then nothing may be concluded from the id.
  int descriptor() const { return descriptor_.get(); }

 private:
  const std::int64_t processID_;
  const OwnedDescriptor descriptor_;
};

}  // namespace kel::platform
