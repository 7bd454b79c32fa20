#include "platform/linux/conduit/conduit_frames.h"

#include <algorithm>
#include <concepts>
#include <utility>

// Framing. One buffer holds, from its start: what was handed out already, the bytes from `begin_` to `end_`
// that were not, and room for more. A frame is handed out where it lies, so that a payload is never copied;
// that is why asking for room, which moves the rest to the front, ends the life of the last one.
//
// The buffer grows by what arrived, not by what a header promises: at most to twice its size, and no further
// than the frame at hand needs. A header that claims a gigabyte costs 4 KiB until the gigabyte comes.
// Doubling keeps the copying in proportion to the bytes; and the rest that moves to the front is always less
// than one frame. Once all is handed out a buffer that a large frame made large is given back, for
// connections are idle most of the time.
//
// A header is judged as soon as its 16 bytes are there, before the payload: an unknown kind, a length that
// its kind cannot have, an answer that belongs to no request. Behind such a header nobody knows where the
// next frame begins, so there is none: the error stays.
namespace kel::platform {

namespace {

constexpr std::size_t smallBuffer = 4096;
constexpr std::size_t largestIdleBuffer = 65536;

template <std::unsigned_integral Number>
Number readNumber(BytesView bytes) {
  Number number = 0;
  for (const std::uint8_t byte : bytes.first(sizeof number)) number = static_cast<Number>(number << 8 | byte);
  return number;
}

template <std::unsigned_integral Number>
void appendNumber(Bytes& bytes, Number number) {
  for (std::size_t i = sizeof number; i-- > 0;) bytes.push_back(static_cast<std::uint8_t>(number >> (8 * i)));
}

}  // namespace

FrameDecoder::FrameDecoder(std::initializer_list<FrameKind> kinds, std::uint32_t largestPayload)
    : kinds_(kinds), largestPayload_(largestPayload) {}

std::span<std::uint8_t> FrameDecoder::room() {
  if (begin_ > 0) {
    std::copy(buffer_.begin() + static_cast<std::ptrdiff_t>(begin_),
              buffer_.begin() + static_cast<std::ptrdiff_t>(end_), buffer_.begin());
    end_ -= std::exchange(begin_, 0);
  }
  if (end_ == buffer_.size()) {
    const auto known = header();
    const std::size_t needed = known ? frameHeaderSize + known->length : frameHeaderSize;
    buffer_.resize(std::max(smallBuffer, std::min(needed, 2 * buffer_.size())));
  }
  return std::span(buffer_).subspan(end_);
}

std::optional<Frame> FrameDecoder::next() {
  if (!error_.empty()) return std::nullopt;
  if (begin_ == end_ && buffer_.size() > largestIdleBuffer) {
    buffer_ = {};
    begin_ = end_ = 0;
  }
  const auto head = header();
  if (!head) return std::nullopt;
  error_ = defect(*head);
  if (!error_.empty() || end_ - begin_ - frameHeaderSize < head->length) return std::nullopt;
  const BytesView payload = BytesView(buffer_).subspan(begin_ + frameHeaderSize, head->length);
  begin_ += frameHeaderSize + head->length;
  return Frame{static_cast<FrameKind>(head->kind), head->tag, payload};
}

std::optional<FrameDecoder::Header> FrameDecoder::header() const {
  if (end_ - begin_ < frameHeaderSize) return std::nullopt;
  const BytesView bytes = BytesView(buffer_).subspan(begin_, frameHeaderSize);
  return Header{readNumber<std::uint32_t>(bytes), readNumber<std::uint32_t>(bytes.subspan(4)),
                readNumber<std::uint64_t>(bytes.subspan(8))};
}

std::string FrameDecoder::defect(const Header& header) const {
  const auto kind = static_cast<FrameKind>(header.kind);
  if (std::find(kinds_.begin(), kinds_.end(), kind) == kinds_.end()) {
    return "unexpected frame kind " + std::to_string(header.kind);
  }
  const bool isEmpty = header.length == 0;
  if (isEmpty != (kind == FrameKind::Dropped) || header.length > largestPayload_) {
    return "frame length " + std::to_string(header.length);
  }
  if (kind != FrameKind::Request && header.tag == 0) return "answer without a reply tag";
  return {};
}

std::vector<SharedSlice> makeFrame(FrameKind kind, std::uint64_t tag, PropertyListPieces payload) {
  Bytes header;
  header.reserve(frameHeaderSize);
  appendNumber(header, static_cast<std::uint32_t>(payload.size));
  appendNumber(header, static_cast<std::uint32_t>(kind));
  appendNumber(header, tag);

  std::vector<SharedSlice> frame;
  frame.reserve(payload.pieces.size() + 1);
  frame.push_back({std::make_shared<const Bytes>(std::move(header)), 0, frameHeaderSize});
  std::move(payload.pieces.begin(), payload.pieces.end(), std::back_inserter(frame));
  return frame;
}

}  // namespace kel::platform
