#include "platform/linux/conduit/conduit_client_connection.h"

#include <cassert>
#include <cerrno>
#include <sys/socket.h>
#include <utility>

#include "platform/linux/conduit/endpoint_socket.h"
#include "platform/linux/conduit/outgoing_bytes.h"
#include "property_lists/property_list.h"

namespace kel::platform {

namespace {

ConduitError errorObject(ConduitError::Kind kind) {
  return {kind,
          kind == ConduitError::Kind::ConnectionInvalid ? "Connection invalid" : "Connection interrupted"};
}

}  // namespace

void ConduitClientConnection::setEventHandler(ConduitEventHandler handler) {
  const MutexLock lock(exchanging_);
  handler_ = std::make_shared<const ConduitEventHandler>(std::move(handler));
}

void ConduitClientConnection::start() {
  const MutexLock lock(exchanging_);
  if (!path_.empty()) socket_ = connectToEndpoint(path_, 0);
  if (!socket_) fail(ConduitError::Kind::ConnectionInvalid);
}

ConduitReply ConduitClientConnection::sendAndWait(const PropertyListValue& contents) {
  assert(!queue_.isCurrent());
  const MutexLock lock(exchanging_);
  return exchange(contents);
}

ConduitReply ConduitClientConnection::exchange(const PropertyListValue& contents) {
  if (!socket_) return fail(ConduitError::Kind::ConnectionInvalid);
  PropertyListPieces pieces = writeBinaryPropertyListPieces(contents);
  if (!pieces.error.empty()) return ConduitError{ConduitError::Kind::Other, pieces.error};
  if (pieces.size > largestRequest) {
    return ConduitError{ConduitError::Kind::Other, "The request is too large"};
  }
  const std::uint64_t tag = ++lastTag_;
  if (!send(makeFrame(FrameKind::Request, tag, std::move(pieces)))) {
    socket_.reset();
    return fail(ConduitError::Kind::ConnectionInterrupted);
  }
  return receive(tag);
}

bool ConduitClientConnection::send(std::vector<SharedSlice> frame) {
  OutgoingBytes outgoing;
  outgoing.add(std::move(frame));
  while (!outgoing.empty()) {
    if (outgoing.sendSome(socket_.get()) != OutgoingBytes::Result::Sent) return false;
  }
  return true;
}

ConduitReply ConduitClientConnection::receive(std::uint64_t tag) {
  for (;;) {
    if (const std::optional<Frame> frame = decoder_.next()) {
      // Requests go one by one: an answer to another one means that the server is at fault.
      if (frame->tag != tag) break;
      if (frame->kind == FrameKind::Dropped) return fail(ConduitError::Kind::ConnectionInterrupted);
      PropertyListReading reading = readBinaryPropertyList(frame->payload);
      if (!reading.value) break;
      return std::move(*reading.value);
    }
    if (!decoder_.error().empty()) break;
    const std::span<std::uint8_t> room = decoder_.room();
    const ssize_t count = recv(socket_.get(), room.data(), room.size(), 0);
    if (count < 0 && errno == EINTR) continue;
    if (count <= 0) break;
    decoder_.received(static_cast<std::size_t>(count));
  }
  // Whatever comes later could not be told from the answer to a later request.
  socket_.reset();
  return fail(ConduitError::Kind::ConnectionInterrupted);
}

ConduitReply ConduitClientConnection::fail(ConduitError::Kind kind) {
  const ConduitError error = errorObject(kind);
  const auto handler = std::exchange(handler_, nullptr);
  if (handler && *handler) queue_.async([handler, error] { (*handler)(error); });
  return error;
}

}  // namespace kel::platform
