#include "platform/linux/conduit/outgoing_bytes.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <sys/socket.h>
#include <sys/uio.h>
#include <utility>

namespace kel::platform {

void OutgoingBytes::add(std::vector<SharedSlice> slices) {
  for (SharedSlice& slice : slices) {
    if (slice.length == 0) continue;
    size_ += slice.length;
    slices_.push_back(std::move(slice));
  }
}

void OutgoingBytes::clear() {
  slices_.clear();
  size_ = 0;
}

OutgoingBytes::Result OutgoingBytes::sendSome(int socket) {
  // Enough to fill a socket's buffer in one call, mostly; what is left goes with the next.
  std::array<iovec, 64> parts;
  const std::size_t count = std::min(parts.size(), slices_.size());
  for (std::size_t i = 0; i < count; ++i) {
    const BytesView view = slices_[i].view();
    parts[i] = {const_cast<std::uint8_t*>(view.data()), view.size()};
  }
  msghdr message{};
  message.msg_iov = parts.data();
  message.msg_iovlen = count;
  const ssize_t sent = sendmsg(socket, &message, MSG_NOSIGNAL);
  if (sent < 0) {
    if (errno == EINTR) return Result::Sent;
    return errno == EAGAIN ? Result::WouldBlock : Result::Broken;
  }
  consume(static_cast<std::size_t>(sent));
  return Result::Sent;
}

void OutgoingBytes::consume(std::size_t count) {
  size_ -= count;
  while (count > 0) {
    SharedSlice& first = slices_.front();
    const std::size_t taken = std::min(count, first.length);
    first.offset += taken;
    first.length -= taken;
    count -= taken;
    if (first.length == 0) slices_.pop_front();
  }
}

}  // namespace kel::platform
