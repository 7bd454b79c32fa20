#pragma once

#include <memory>
#include <mutex>
#include <string>

#include "platform/conduit.h"
#include "platform/linux/conduit/conduit_frames.h"
#include "platform/linux/files/owned_descriptor.h"
#include "platform/linux/queues/event_loop.h"

namespace kel::platform {

/// The client's end: blocking, on the threads that send. Any thread; requests of several threads go one after
/// the other.
///
/// The first error object that `start` or `sendAndWait` meets also goes to the event handler. Between
/// requests nobody listens: that the server has gone shows when the next request is sent.
class ConduitClientConnection final : public ConduitConnection {
 public:
  /// `path` is the endpoint's socket file; empty when there is none. `queue`, which outlives the connection,
  /// gets the error event.
  ConduitClientConnection(std::string path, SerialQueue& queue) : path_(std::move(path)), queue_(queue) {}

  /// Null.
  std::shared_ptr<const PeerProcess> peer() const override { return nullptr; }
  void setEventHandler(ConduitEventHandler handler) override;
  void start() override;
  ConduitReply sendAndWait(const PropertyListValue& contents) override;

 private:
  ConduitReply exchange(const PropertyListValue& contents);
  bool send(std::vector<SharedSlice> frame);
  ConduitReply receive(std::uint64_t tag);
  ConduitReply fail(ConduitError::Kind kind);

  const std::string path_;
  SerialQueue& queue_;

  // Held over a whole exchange, which is all that it is for.
  std::mutex exchanging_;
  OwnedDescriptor socket_;  // none before `start` and when the connection is over
  FrameDecoder decoder_{{FrameKind::Reply, FrameKind::Dropped}, largestReply};
  std::uint64_t lastTag_ = 0;
  std::shared_ptr<const ConduitEventHandler> handler_;  // null when it got its event
};

}  // namespace kel::platform
