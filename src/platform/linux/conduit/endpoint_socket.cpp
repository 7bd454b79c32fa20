#include "platform/linux/conduit/endpoint_socket.h"

#include <cerrno>
#include <fcntl.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>
#include <utility>

#include "platform/linux/files/files.h"
#include "platform/linux/process/unix_address.h"

namespace kel::platform {

namespace {

EndpointBinding failed(const std::string& path) { return {std::nullopt, false, errorLine(path, errno)}; }

EndpointBinding servedElsewhere(const std::string& path) {
  return {std::nullopt, true, path + ": another server holds the endpoint"};
}

enum class Occupant { Nobody, Dead, Live, Unknown };

/// Whose socket file `path` is; `errno` says why for `Unknown`.
Occupant occupant(const std::string& path) {
  struct stat status {};
  if (lstat(path.c_str(), &status) != 0) return errno == ENOENT ? Occupant::Nobody : Occupant::Unknown;
  if (!S_ISSOCK(status.st_mode)) {
    errno = EEXIST;
    return Occupant::Unknown;
  }
  // A full queue of connections (EAGAIN) has a server that is to accept them.
  if (connectToEndpoint(path, SOCK_NONBLOCK) || errno == EAGAIN) return Occupant::Live;
  return errno == ECONNREFUSED ? Occupant::Dead : Occupant::Unknown;
}

/// Bound and listening, reachable for the user alone whatever the file-creation mask.
OwnedDescriptor bindAndListen(const std::string& path) {
  OwnedDescriptor socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  const auto address = unixAddress(path);
  if (!address) errno = ENAMETOOLONG;
  // The socket's own mode is what its file is made with.
  if (!socket || !address || fchmod(socket.get(), 0600) != 0 ||
      bind(socket.get(), address->get(), address->length) != 0 || chmod(path.c_str(), 0600) != 0 ||
      listen(socket.get(), SOMAXCONN) != 0) {
    return {};
  }
  return socket;
}

}  // namespace

// Under the lock still, so that it cannot be the file of a server that has just taken over.
EndpointSocket::~EndpointSocket() {
  if (socket_ && !path_.empty()) unlink(path_.c_str());
}

EndpointBinding bindEndpoint(const std::string& path) {
  OwnedDescriptor lock = openFile(AT_FDCWD, path + ".lock", O_RDWR | O_CREAT | O_NOFOLLOW | O_NONBLOCK, 0600);
  if (!lock) return failed(path + ".lock");
  // A lock, not the socket file, decides: between finding a dead server's file and replacing it another
  // server could have put its own there.
  while (flock(lock.get(), LOCK_EX | LOCK_NB) != 0) {
    if (errno == EWOULDBLOCK) return servedElsewhere(path);
    if (errno != EINTR) return failed(path + ".lock");
  }
  switch (occupant(path)) {
    case Occupant::Live:
      return servedElsewhere(path);
    case Occupant::Unknown:
      return failed(path);
    case Occupant::Dead:
      if (unlink(path.c_str()) != 0) return failed(path);
      break;
    case Occupant::Nobody:
      break;
  }
  OwnedDescriptor socket = bindAndListen(path);
  if (!socket) return failed(path);
  EndpointBinding binding;
  binding.socket.emplace(std::move(socket), std::move(lock), path);
  return binding;
}

OwnedDescriptor connectToEndpoint(const std::string& path, int flags) {
  const auto address = unixAddress(path);
  if (!address) {
    errno = ENAMETOOLONG;
    return {};
  }
  OwnedDescriptor socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | flags, 0));
  if (!socket) return {};
  while (connect(socket.get(), address->get(), address->length) != 0) {
    if (errno == EINTR) continue;
    const int error = errno;
    socket.reset();
    errno = error;
    return {};
  }
  return socket;
}

}  // namespace kel::platform
