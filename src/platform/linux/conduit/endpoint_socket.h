#pragma once

#include <optional>
#include <string>
#include <utility>

#include "platform/linux/files/owned_descriptor.h"

namespace kel::platform {

/// A listening, non-blocking Unix stream socket. When it was bound here, destroying it removes its file and
/// then lets go of the lock.
class EndpointSocket {
 public:
  /// A socket that the launcher listens on too: its file is the launcher's.
  explicit EndpointSocket(OwnedDescriptor socket) : socket_(std::move(socket)) {}

  /// A socket bound to `path` under `lock`.
  EndpointSocket(OwnedDescriptor socket, OwnedDescriptor lock, std::string path)
      : lock_(std::move(lock)), socket_(std::move(socket)), path_(std::move(path)) {}

  EndpointSocket(EndpointSocket&&) = default;
  EndpointSocket& operator=(EndpointSocket&&) = delete;
  ~EndpointSocket();

  int get() const { return socket_.get(); }

 private:
  OwnedDescriptor lock_;
  OwnedDescriptor socket_;
  std::string path_;
};

struct EndpointBinding {
  std::optional<EndpointSocket> socket;
  bool servedElsewhere = false;  ///< a live server holds the endpoint
  std::string error;             ///< one line, when there is no socket
};

/// Binds `path`, absolute, a socket file in a directory that only the user may write to. A lock file beside
/// it keeps other servers out for the socket's life; the file that a dead server left is replaced, a live
/// one's never.
EndpointBinding bindEndpoint(const std::string& path);

/// Connects to the socket file `path`, with the flags for the new socket (SOCK_NONBLOCK or none). None, with
/// errno set, when that fails: ECONNREFUSED or ENOENT mean that nobody listens. A blocking one waits for a
/// busy server to accept.
OwnedDescriptor connectToEndpoint(const std::string& path, int flags);

}  // namespace kel::platform
