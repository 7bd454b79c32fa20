#pragma once

#include <memory>
#include <string>

#include "platform/conduit.h"
#include "platform/linux/conduit/conduit_frames.h"
#include "platform/linux/files/owned_descriptor.h"
#include "platform/linux/queues/mutex.h"

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
  ConduitReply exchange(const PropertyListValue& contents) KEL_RUNS_ON(exchanging_);
  bool send(std::vector<SharedSlice> frame) KEL_RUNS_ON(exchanging_);
  ConduitReply receive(std::uint64_t tag) KEL_RUNS_ON(exchanging_);
  ConduitReply fail(ConduitError::Kind kind) KEL_RUNS_ON(exchanging_);

  const std::string path_;
  SerialQueue& queue_;

  // Held until a request has its answer, also while the server works on it: so requests go one by one.
  Mutex exchanging_;
  OwnedDescriptor socket_ KEL_ON(exchanging_);  // none before `start` and when the connection is over
  FrameDecoder decoder_ KEL_ON(exchanging_){{FrameKind::Reply, FrameKind::Dropped}, largestReply};
  std::uint64_t lastTag_ KEL_ON(exchanging_) = 0;
  std::shared_ptr<const ConduitEventHandler> handler_ KEL_ON(exchanging_);  // null once it was told the error
};

}  // namespace kel::platform
