#pragma once

#include <cstddef>
#include <cstdint>
#include <initializer_list>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "property_lists/bytes.h"
#include "property_lists/property_list.h"

// What travels on a connection of the conduit, byte by byte: docs/wire-format.md.
namespace kel::platform {

enum class FrameKind : std::uint32_t { Request = 1, Reply = 2, Dropped = 3 };

inline constexpr std::size_t frameHeaderSize = 16;
inline constexpr std::uint32_t largestRequest = 1U << 20;
inline constexpr std::uint32_t largestReply = 1U << 30;

struct Frame {
  FrameKind kind = FrameKind::Request;
  std::uint64_t tag = 0;
  BytesView payload;  ///< valid until the decoder is called again
};

/// Cuts a stream of foreign bytes into frames. Memory grows with the bytes that arrived, never with what a
/// header promises. For one thread.
class FrameDecoder {
 public:
  /// Accepts frames of these `kinds` with payloads of at most `largestPayload` bytes.
  FrameDecoder(std::initializer_list<FrameKind> kinds, std::uint32_t largestPayload);

  /// Where the next bytes of the stream go; never empty. Only when `next` has returned nothing.
  std::span<std::uint8_t> room();

  /// States that the first `count` bytes of `room` have been filled.
  void received(std::size_t count) { end_ += count; }

  /// The next whole frame; absent when more bytes are needed, or when the stream is malformed.
  std::optional<Frame> next();

  /// What is malformed, one line; empty as long as nothing is. There is no frame after an error.
  const std::string& error() const { return error_; }

  /// True when bytes are there that are not yet a whole frame. Meaningful when `next` has returned nothing.
  bool isMidFrame() const { return begin_ != end_; }

 private:
  struct Header {
    std::uint32_t length = 0;
    std::uint32_t kind = 0;
    std::uint64_t tag = 0;
  };

  std::optional<Header> header() const;
  std::string defect(const Header& header) const;

  const std::vector<FrameKind> kinds_;
  const std::uint32_t largestPayload_;
  Bytes buffer_;
  std::size_t begin_ = 0;  // of what arrived and was not handed out
  std::size_t end_ = 0;
  std::string error_;
};

/// A frame ready to be sent: its header, then the payload's pieces as they are. `payload` holds at most 4
/// GiB.
std::vector<SharedSlice> makeFrame(FrameKind kind, std::uint64_t tag, PropertyListPieces payload);

}  // namespace kel::platform
