#pragma once

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/clock.h"
#include "platform/conduit.h"
#include "platform/linux/conduit/conduit_frames.h"
#include "platform/linux/conduit/outgoing_bytes.h"
#include "platform/linux/process/linux_peer_process.h"
#include "platform/linux/queues/event_loop.h"
#include "platform/system_log.h"

namespace kel::platform {

/// What the server's end of the conduit works with. Borrowed: all of it outlives the listener.
struct ConduitServerContext {
  SerialQueue& queue;
  Clock& clock;
  SystemLog& log;
};

/// One accepted connection: requests come in, answers go out, and no peer, however slow, silent or hostile,
/// takes more than its share.
///
/// Affinity: the listener's queue, but for `settle`. A peer with 8 requests in flight, or with more than 1
/// MiB of answers that it does not take, is not read from until that has changed. One that leaves a message
/// half sent for 10 to 20 seconds, or takes nothing of its answers for a minute, is disconnected.
class ConduitServerConnection final : public ConduitConnection,
                                      public std::enable_shared_from_this<ConduitServerConnection> {
 public:
  /// Takes a connected, non-blocking `socket`. `gone` is called once, before the last event, when the
  /// connection has ended of itself.
  ConduitServerConnection(const ConduitServerContext& context, OwnedDescriptor socket,
                          std::shared_ptr<const LinuxPeerProcess> peer, std::function<void()> gone);

  /// Begins to watch for the peer's going; false when the kernel refuses. Once, before everything else.
  bool open();

  /// Ends the connection without an event.
  void shut();

  /// Ends the connection with a line in the log that gives the reason; the event follows as a later task.
  void refuse(const std::string& reason);

  /// True when no request is in flight and nothing is to be sent.
  bool isIdle() const;

  /// Takes one request off those in flight and sends `frame`, which may be empty. Any thread.
  void settle(std::vector<SharedSlice> frame);

  /// Writes a line about this connection to the system log. Any thread.
  void log(const std::string& text) const;

  std::shared_ptr<const PeerProcess> peer() const override { return peer_; }
  void setEventHandler(ConduitEventHandler handler) override;
  void start() override;

  /// Always an error object: requests come from the other end.
  ConduitReply sendAndWait(const PropertyListValue& contents) override;

 private:
  bool mayTake() const KEL_RUNS_ON(loop_);
  void serve(std::uint32_t events) KEL_RUNS_ON(loop_);
  void receive() KEL_RUNS_ON(loop_);
  void takeRequests() KEL_RUNS_ON(loop_);
  void take(const Frame& frame) KEL_RUNS_ON(loop_);
  void settleHere(std::vector<SharedSlice> frame) KEL_RUNS_ON(loop_);
  void flush() KEL_RUNS_ON(loop_);
  void updateInterest() KEL_RUNS_ON(loop_);
  void watchProgress() KEL_RUNS_ON(loop_);
  void checkProgress() KEL_RUNS_ON(loop_);
  void breakOff() KEL_RUNS_ON(loop_);
  void finish() KEL_RUNS_ON(loop_);
  void deliverInvalid() KEL_RUNS_ON(loop_);

  // Fixed after construction. The loop is kept because messages may be answered when the queue has ended.
  const ConduitServerContext context_;
  const std::shared_ptr<EventLoop> keptLoop_;
  EventLoop& loop_;
  const std::shared_ptr<const LinuxPeerProcess> peer_;
  const std::function<void()> gone_;

  OwnedDescriptor socket_ KEL_ON(loop_);
  std::unique_ptr<EventLoop::Watch> watch_ KEL_ON(loop_);
  std::uint32_t interest_ KEL_ON(loop_) = 0;
  std::shared_ptr<const ConduitEventHandler> handler_ KEL_ON(loop_);
  FrameDecoder decoder_ KEL_ON(loop_){{FrameKind::Request}, largestRequest};
  OutgoingBytes outgoing_ KEL_ON(loop_);
  std::size_t inFlight_ KEL_ON(loop_) = 0;
  bool started_ KEL_ON(loop_) = false;
  bool takingRequests_ KEL_ON(loop_) = false;
  bool broken_ KEL_ON(loop_) = false;  // nothing is read or sent any more
  bool closed_ KEL_ON(loop_) = false;

  // Progress, compared with what it was when the timer was set.
  bool timerRuns_ KEL_ON(loop_) = false;
  std::uint64_t received_ KEL_ON(loop_) = 0;
  std::uint64_t sent_ KEL_ON(loop_) = 0;
  std::uint64_t receivedBefore_ KEL_ON(loop_) = 0;
  std::uint64_t sentBefore_ KEL_ON(loop_) = 0;
  int intervalsWithoutSending_ KEL_ON(loop_) = 0;
};

}  // namespace kel::platform
