#include "platform/linux/conduit/conduit_server_connection.h"

#include <cassert>
#include <cerrno>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <utility>

#include "platform/linux/conduit/conduit_server_message.h"
#include "platform/linux/queues/serial_queue.h"
#include "platform/linux/queues/while_alive.h"
#include "property_lists/property_list.h"

// How a connection lives, what it may cost and how it ends.
//
// The acceptor opens it; until `start` the peer's going is all that is watched for, and nothing is read. From
// then on every round is alike, whatever began it (bytes came, there is room to send, an answer is ready,
// time passed): frames are taken from the decoder as long as `mayTake` allows, then the watch is set to what
// is worth waiting for. A request is in flight from there until its message is answered or destroyed, on
// whichever thread that happens; `settle` brings it back to the loop, once for each, with the bytes of the
// answer.
//
// What a peer costs is counted where it arises: requests in flight, bytes of answers not taken. Either at its
// limit stops the reading, so the kernel's buffers fill up and the peer waits; nothing is dropped for it. One
// timer compares the bytes that moved with those of an interval ago. It runs only while the peer is the one
// to act: who is kept waiting by us is never blamed for silence.
//
// The end has two steps. `breakOff` may be called from anywhere, also deep inside the handler: from there on
// nothing is read or sent. `finish`, a task of its own, closes the socket, lets the acceptor forget the
// connection and tells the handler. `shut` is the acceptor's own end, which tells nobody.
//
// Never happens: an event before `start` or after the last one; one request delivered inside the delivery of
// another (an answer given at once comes back to `takeRequests`, which is then at work); an answer to a peer
// that did not ask for it, since a message knows its own connection, weakly, and is answered into nothing
// when that is gone.
namespace kel::platform {

namespace {

using namespace std::chrono_literals;

constexpr std::size_t mostRequestsInFlight = 8;
constexpr std::size_t mostUnsentBytes = 1U << 20;
constexpr std::uint64_t largestExpandedRequest = 4U << 20;
constexpr auto progressInterval = 10s;
constexpr int longestSilentSending = 6;  // intervals
constexpr int sendsInARow = 8;           // then the other connections have their turn

}  // namespace

ConduitServerConnection::ConduitServerConnection(const ConduitServerContext& context, OwnedDescriptor socket,
                                                 std::shared_ptr<const LinuxPeerProcess> peer,
                                                 std::function<void()> gone)
    : context_(context),
      keptLoop_(eventLoop(context.queue).shared_from_this()),
      loop_(*keptLoop_),
      peer_(std::move(peer)),
      gone_(std::move(gone)),
      socket_(std::move(socket)) {}

bool ConduitServerConnection::open() {
  loop_.assertCurrent();
  watch_ = loop_.watch(socket_.get(), interest_,
                       whileAlive(weak_from_this(), loop_, &ConduitServerConnection::serve));
  return watch_ != nullptr;
}

void ConduitServerConnection::shut() {
  loop_.assertCurrent();
  closed_ = true;
  watch_.reset();
  socket_.reset();
  outgoing_.clear();
  // The handler commonly holds the connection; and it may be running, so that it is only let go of here.
  const auto handler = std::exchange(handler_, nullptr);
}

void ConduitServerConnection::refuse(const std::string& reason) {
  loop_.assertCurrent();
  if (broken_ || closed_) return;
  log("closing the connection: " + reason);
  breakOff();
}

bool ConduitServerConnection::isIdle() const {
  loop_.assertCurrent();
  return inFlight_ == 0 && outgoing_.empty() && !broken_ && !closed_;
}

void ConduitServerConnection::log(const std::string& text) const {
  context_.log.write("conduit: process " + std::to_string(peer_->processID()) + ": " + text);
}

void ConduitServerConnection::setEventHandler(ConduitEventHandler handler) {
  loop_.assertCurrent();
  assert(!started_);
  handler_ = std::make_shared<const ConduitEventHandler>(std::move(handler));
}

void ConduitServerConnection::start() {
  loop_.assertCurrent();
  started_ = true;
  if (closed_) {
    loop_.async([self = shared_from_this()] {
      self->loop_.assertCurrent();
      self->deliverInvalid();
    });
    return;
  }
  takeRequests();
}

ConduitReply ConduitServerConnection::sendAndWait(const PropertyListValue&) {
  return ConduitError{ConduitError::Kind::Other, "Requests come from the client"};
}

bool ConduitServerConnection::mayTake() const {
  return started_ && !broken_ && !closed_ && inFlight_ < mostRequestsInFlight &&
         outgoing_.size() <= mostUnsentBytes;
}

void ConduitServerConnection::serve(std::uint32_t events) {
  if ((events & EPOLLOUT) != 0) flush();
  takeRequests();
  if (broken_ || closed_) return;
  const bool hungUp = (events & (EPOLLHUP | EPOLLERR)) != 0;
  if (mayTake() && (hungUp || (events & EPOLLIN) != 0)) {
    receive();
    takeRequests();
  } else if (hungUp) {
    // Nobody is left to take an answer, so what is still to be read is not worth waiting for.
    breakOff();
  }
}

void ConduitServerConnection::receive() {
  const std::span<std::uint8_t> room = decoder_.room();
  // Without room for control messages the kernel closes descriptors that somebody sends, at once and before
  // they take a number in this process.
  const ssize_t count = recv(socket_.get(), room.data(), room.size(), MSG_DONTWAIT);
  if (count < 0 && (errno == EAGAIN || errno == EWOULDBLOCK || errno == EINTR)) return;
  if (count <= 0) return breakOff();
  decoder_.received(static_cast<std::size_t>(count));
  received_ += static_cast<std::uint64_t>(count);
}

void ConduitServerConnection::takeRequests() {
  // An answer that is given at once comes back here while the requests are being taken.
  if (takingRequests_) return;
  takingRequests_ = true;
  while (mayTake()) {
    const std::optional<Frame> frame = decoder_.next();
    if (!frame) break;
    take(*frame);
  }
  takingRequests_ = false;
  if (broken_ || closed_) return;
  if (!decoder_.error().empty()) return refuse("malformed message: " + decoder_.error());
  updateInterest();
  watchProgress();
}

void ConduitServerConnection::take(const Frame& frame) {
  PropertyListLimits limits;
  limits.expandedSize = largestExpandedRequest;
  PropertyListReading reading = readBinaryPropertyList(frame.payload, limits);
  if (!reading.value) return refuse("malformed message: " + reading.error);
  ++inFlight_;
  const ConduitEvent event = std::shared_ptr<ConduitMessage>(std::make_shared<ConduitServerMessage>(
      weak_from_this(), keptLoop_, frame.tag, std::move(*reading.value)));
  const std::shared_ptr<const ConduitEventHandler> handler = handler_;
  if (handler && *handler) (*handler)(event);
}

void ConduitServerConnection::settle(std::vector<SharedSlice> frame) {
  if (loop_.isCurrent()) {
    loop_.assertCurrent();
    settleHere(std::move(frame));
    return;
  }
  loop_.async([self = shared_from_this(), frame = std::move(frame)] {
    self->loop_.assertCurrent();
    self->settleHere(frame);
  });
}

void ConduitServerConnection::settleHere(std::vector<SharedSlice> frame) {
  --inFlight_;
  if (broken_ || closed_) return;
  const bool wasEmpty = outgoing_.empty();
  outgoing_.add(std::move(frame));
  if (wasEmpty) flush();
  takeRequests();
}

void ConduitServerConnection::flush() {
  const std::size_t before = outgoing_.size();
  for (int i = 0; i < sendsInARow && !outgoing_.empty(); ++i) {
    const OutgoingBytes::Result result = outgoing_.sendSome(socket_.get());
    if (result == OutgoingBytes::Result::Broken) return breakOff();
    if (result == OutgoingBytes::Result::WouldBlock) break;
  }
  sent_ += before - outgoing_.size();
}

void ConduitServerConnection::updateInterest() {
  const std::uint32_t wanted = (mayTake() ? EPOLLIN : 0U) | (outgoing_.empty() ? 0U : EPOLLOUT);
  if (wanted == interest_) return;
  interest_ = wanted;
  watch_->setEvents(wanted);
}

void ConduitServerConnection::watchProgress() {
  const bool waits = (mayTake() && decoder_.isMidFrame()) || !outgoing_.empty();
  if (timerRuns_ || !waits) return;
  timerRuns_ = true;
  receivedBefore_ = received_;
  sentBefore_ = sent_;
  context_.clock.after(context_.queue, progressInterval,
                       whileAlive(weak_from_this(), loop_, &ConduitServerConnection::checkProgress));
}

void ConduitServerConnection::checkProgress() {
  // What arrived while the queue was busy is not held against the peer.
  if (mayTake()) {
    receive();
    takeRequests();
  }
  if (broken_ || closed_) return;
  if (mayTake() && decoder_.isMidFrame() && received_ == receivedBefore_) {
    return refuse("a message stays half sent");
  }
  const bool sendingStalls = !outgoing_.empty() && sent_ == sentBefore_;
  intervalsWithoutSending_ = sendingStalls ? intervalsWithoutSending_ + 1 : 0;
  if (intervalsWithoutSending_ == longestSilentSending) return refuse("its answers are not taken");
  timerRuns_ = false;
  watchProgress();
}

void ConduitServerConnection::breakOff() {
  if (broken_ || closed_) return;
  broken_ = true;
  watch_.reset();
  // The event goes out as a task of its own: this may run inside the handler.
  loop_.async([self = shared_from_this()] {
    self->loop_.assertCurrent();
    self->finish();
  });
}

void ConduitServerConnection::finish() {
  if (closed_) return;
  // Kept over the closing, for the last event.
  const auto handler = handler_;
  shut();
  handler_ = handler;
  gone_();
  if (started_) deliverInvalid();
}

void ConduitServerConnection::deliverInvalid() {
  const std::shared_ptr<const ConduitEventHandler> handler = std::exchange(handler_, nullptr);
  if (handler && *handler) {
    (*handler)(ConduitError{ConduitError::Kind::ConnectionInvalid, "Connection invalid"});
  }
}

}  // namespace kel::platform
