#include "platform/linux/process/linux_peer_process.h"

#include <cerrno>
#include <fcntl.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <unistd.h>

#ifndef SO_PEERPIDFD
#define SO_PEERPIDFD 77
#endif

namespace kel::platform {

namespace {

OwnedDescriptor processDescriptor(int socket, std::int64_t processID) {
  int descriptor = -1;
  socklen_t length = sizeof descriptor;
  if (getsockopt(socket, SOL_SOCKET, SO_PEERPIDFD, &descriptor, &length) == 0) {
    return OwnedDescriptor(descriptor);
  }
  // Only a kernel that does not know the option is asked by number: where it knows it and fails, the process
  // is gone and the number may be another's.
  if (errno != ENOPROTOOPT) return {};
  return OwnedDescriptor(static_cast<int>(syscall(SYS_pidfd_open, static_cast<pid_t>(processID), 0U)));
}

}  // namespace

std::shared_ptr<const LinuxPeerProcess> LinuxPeerProcess::ofSocket(int socket, std::int64_t processID) {
  return std::make_shared<const LinuxPeerProcess>(processID, processDescriptor(socket, processID));
}

}  // namespace kel::platform
