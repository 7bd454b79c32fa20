// Frames out of a stream that is cut anywhere: the decoder must find the same frames, and the same error, as
// when the whole stream comes at once.

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>
#include <vector>

#include "platform/linux/conduit/conduit_frames.h"

namespace {

using namespace kel::platform;

constexpr std::uint32_t largestPayload = 1U << 16;

struct Decoding {
  std::vector<std::string> frames;
  std::string error;

  bool operator==(const Decoding&) const = default;
};

/// Feeds `stream` in chunks whose lengths are one more than the bytes of `chunks`, again and again; the last
/// ones, and all without chunks, are as long as there is room.
Decoding decode(BytesView stream, BytesView chunks) {
  FrameDecoder decoder({FrameKind::Request, FrameKind::Reply, FrameKind::Dropped}, largestPayload);
  Decoding result;
  for (std::size_t i = 0; !stream.empty() && result.error.empty(); ++i) {
    const std::span<std::uint8_t> room = decoder.room();
    if (room.empty()) std::abort();
    std::size_t count = std::min(room.size(), stream.size());
    if (!chunks.empty()) count = std::min<std::size_t>(count, chunks[i % chunks.size()] + std::size_t{1});
    std::copy_n(stream.begin(), count, room.begin());
    stream = stream.subspan(count);
    decoder.received(count);
    while (const auto frame = decoder.next()) {
      if (frame->payload.size() > largestPayload) std::abort();
      result.frames.push_back(std::to_string(static_cast<std::uint32_t>(frame->kind)) + " " +
                              std::to_string(frame->tag) + " " +
                              std::string(frame->payload.begin(), frame->payload.end()));
    }
    result.error = decoder.error();
  }
  return result;
}

}  // namespace

/// Input: a count, that many chunk lengths, the stream.
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const BytesView input(data, size);
  if (input.empty()) return 0;
  const std::size_t count = std::min<std::size_t>(input[0], size - 1);
  const BytesView chunks = input.subspan(1, count);
  const BytesView stream = input.subspan(1 + count);
  if (decode(stream, chunks) != decode(stream, {})) std::abort();
  return 0;
}
