#pragma once

#include <cstdint>
#include <map>
#include <memory>

#include "platform/linux/conduit/conduit_server_connection.h"
#include "platform/linux/conduit/endpoint_socket.h"

namespace kel::platform {

/// Accepts the connections of one endpoint and owns them.
///
/// Affinity: the listener's queue. Connections are accepted in bursts of bounded length; only processes with
/// the server's own effective user id are served. When descriptors run out a connection is given up, the
/// oldest that is idle where there are too many, else the newest.
class ConduitAcceptor : public std::enable_shared_from_this<ConduitAcceptor> {
 public:
  ConduitAcceptor(const ConduitServerContext& context, EndpointSocket endpoint, ConduitEventHandler handler);

  /// Begins to accept; what goes wrong is an error event. Once.
  void open();

  /// Closes the endpoint and every connection, without events. On the queue or when it has ended.
  void close();

 private:
  enum class Shortage { GaveUpOne, NobodyWaits, Helpless };

  void acceptSome() KEL_RUNS_ON(loop_);
  Shortage giveUpOne() KEL_RUNS_ON(loop_);
  void admit(OwnedDescriptor socket) KEL_RUNS_ON(loop_);
  bool makeRoom() KEL_RUNS_ON(loop_);
  void forget(std::uint64_t age) KEL_RUNS_ON(loop_);
  void rest() KEL_RUNS_ON(loop_);
  void resume() KEL_RUNS_ON(loop_);
  void report(int error) KEL_RUNS_ON(loop_);

  // Fixed after construction.
  const ConduitServerContext context_;
  const std::shared_ptr<EventLoop> keptLoop_;
  EventLoop& loop_;
  const ConduitEventHandler handler_;
  const std::size_t mostConnections_;

  std::optional<EndpointSocket> endpoint_ KEL_ON(loop_);  // absent when closed
  std::unique_ptr<EventLoop::Watch> watch_ KEL_ON(loop_);
  std::map<std::uint64_t, std::shared_ptr<ConduitServerConnection>> connections_ KEL_ON(loop_);  // by age
  std::uint64_t lastConnection_ KEL_ON(loop_) = 0;
  OwnedDescriptor reserve_ KEL_ON(loop_);  // given up to accept, and so to close, when there are no others
  bool isShort_ KEL_ON(loop_) = false;     // of descriptors, and the log says so
  bool isFull_ KEL_ON(loop_) = false;      // new connections are closed, which is told once
};

/// The seam's listener: an acceptor for as long as it lives.
class LinuxConduitListener final : public ConduitListener {
 public:
  LinuxConduitListener(const ConduitServerContext& context, EndpointSocket endpoint,
                       ConduitEventHandler handler);
  ~LinuxConduitListener() override { acceptor_->close(); }
  LinuxConduitListener(const LinuxConduitListener&) = delete;
  LinuxConduitListener& operator=(const LinuxConduitListener&) = delete;

 private:
  const std::shared_ptr<ConduitAcceptor> acceptor_;
};

}  // namespace kel::platform
