#include "property_lists/keyed_hash.h"

#include <bit>
#include <cstring>
#include <random>

namespace kel::platform {

namespace {

// SipHash with one round per word and three at the end: the cheapest of the family that still keeps whoever
// does not know the key from choosing bytes that collide. Nothing here lasts longer than the process, so the
// key does not either.
struct SipState {
  std::uint64_t v0, v1, v2, v3;

  void round() {
    v0 += v1;
    v1 = std::rotl(v1, 13) ^ v0;
    v0 = std::rotl(v0, 32);
    v2 += v3;
    v3 = std::rotl(v3, 16) ^ v2;
    v0 += v3;
    v3 = std::rotl(v3, 21) ^ v0;
    v2 += v1;
    v1 = std::rotl(v1, 17) ^ v2;
    v2 = std::rotl(v2, 32);
  }

  void add(std::uint64_t word) {
    v3 ^= word;
    round();
    v0 ^= word;
  }
};

SipState randomState() {
  std::random_device random;
  const auto word = [&random] { return static_cast<std::uint64_t>(random()) << 32 | random(); };
  const std::uint64_t k0 = word();
  const std::uint64_t k1 = word();
  return {k0 ^ 0x736f6d6570736575U, k1 ^ 0x646f72616e646f6dU, k0 ^ 0x6c7967656e657261U,
          k1 ^ 0x7465646279746573U};
}

}  // namespace

std::uint64_t keyedHash(BytesView bytes) {
  static const SipState start = randomState();
  SipState state = start;
  const std::uint64_t length = bytes.size();
  std::uint64_t word = 0;
  for (; bytes.size() >= sizeof word; bytes = bytes.subspan(sizeof word)) {
    std::memcpy(&word, bytes.data(), sizeof word);
    state.add(word);
  }
  word = 0;
  if (!bytes.empty()) std::memcpy(&word, bytes.data(), bytes.size());
  state.add(word | length << 56);
  state.v2 ^= 0xFF;
  for (int i = 0; i < 3; ++i) state.round();
  return state.v0 ^ state.v1 ^ state.v2 ^ state.v3;
}

}  // namespace kel::platform
