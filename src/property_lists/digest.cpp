#include "property_lists/digest.h"

#include <algorithm>
#include <bit>
#include <cstddef>

namespace kel::platform {

namespace {

constexpr std::size_t blockSize = 64;
using Block = std::array<std::uint8_t, blockSize>;

constexpr std::array<std::uint32_t, 64> sines = {
    0xd76aa478, 0xe8c7b756, 0x242070db, 0xc1bdceee, 0xf57c0faf, 0x4787c62a, 0xa8304613, 0xfd469501,
    0x698098d8, 0x8b44f7af, 0xffff5bb1, 0x895cd7be, 0x6b901122, 0xfd987193, 0xa679438e, 0x49b40821,
    0xf61e2562, 0xc040b340, 0x265e5a51, 0xe9b6c7aa, 0xd62f105d, 0x02441453, 0xd8a1e681, 0xe7d3fbc8,
    0x21e1cde6, 0xc33707d6, 0xf4d50d87, 0x455a14ed, 0xa9e3e905, 0xfcefa3f8, 0x676f02d9, 0x8d2a4c8a,
    0xfffa3942, 0x8771f681, 0x6d9d6122, 0xfde5380c, 0xa4beea44, 0x4bdecfa9, 0xf6bb4b60, 0xbebfbc70,
    0x289b7ec6, 0xeaa127fa, 0xd4ef3085, 0x04881d05, 0xd9d4d039, 0xe6db99e5, 0x1fa27cf8, 0xc4ac5665,
    0xf4292244, 0x432aff97, 0xab9423a7, 0xfc93a039, 0x655b59c3, 0x8f0ccc92, 0xffeff47d, 0x85845dd1,
    0x6fa87e4f, 0xfe2ce6e0, 0xa3014314, 0x4e0811a1, 0xf7537e82, 0xbd3af235, 0x2ad7d2bb, 0xeb86d391};

constexpr int rotations[4][4] = {{7, 12, 17, 22}, {5, 9, 14, 20}, {4, 11, 16, 23}, {6, 10, 15, 21}};

class MD5 {
 public:
  void add(BytesView bytes) {
    length_ += bytes.size();
    if (filled_ > 0) {
      const std::size_t taken = std::min(blockSize - filled_, bytes.size());
      std::copy_n(bytes.begin(), taken, buffer_.begin() + static_cast<std::ptrdiff_t>(filled_));
      filled_ += taken;
      bytes = bytes.subspan(taken);
      if (filled_ < blockSize) return;
      digestBlock(buffer_.data());
      filled_ = 0;
    }
    for (; bytes.size() >= blockSize; bytes = bytes.subspan(blockSize)) digestBlock(bytes.data());
    std::copy(bytes.begin(), bytes.end(), buffer_.begin());
    filled_ = bytes.size();
  }

  Digest finish() {
    // The message ends in a one bit, zeros up to a whole block, and its length: one block more where they do
    // not fit into the last.
    const std::uint64_t bits = length_ * 8;
    std::array<std::uint8_t, blockSize + 8> padding{0x80};
    const std::size_t zeros = (2 * blockSize - 8 - 1 - filled_) % blockSize;
    for (std::size_t i = 0; i < 8; ++i) padding[1 + zeros + i] = static_cast<std::uint8_t>(bits >> 8 * i);
    add(BytesView(padding).first(1 + zeros + 8));
    Digest digest;
    for (std::size_t i = 0; i < digest.size(); ++i) {
      digest[i] = static_cast<std::uint8_t>(state_[i / 4] >> 8 * (i % 4));
    }
    return digest;
  }

 private:
  void digestBlock(const std::uint8_t* bytes) {
    std::array<std::uint32_t, 16> words{};
    for (std::size_t i = 0; i < blockSize; ++i) {
      words[i / 4] |= static_cast<std::uint32_t>(bytes[i]) << 8 * (i % 4);
    }
    auto [a, b, c, d] = state_;
    for (std::size_t i = 0; i < 64; ++i) {
      const std::size_t round = i / 16;
      const std::uint32_t mixed = round == 0   ? (b & c) | (~b & d)
                                  : round == 1 ? (d & b) | (~d & c)
                                  : round == 2 ? b ^ c ^ d
                                               : c ^ (b | ~d);
      const std::size_t word = round == 0   ? i
                               : round == 1 ? (5 * i + 1) % 16
                               : round == 2 ? (3 * i + 5) % 16
                                            : 7 * i % 16;
      const std::uint32_t sum = a + mixed + words[word] + sines[i];
      a = d;
      d = c;
      c = b;
      b += std::rotl(sum, rotations[round][i % 4]);
    }
    state_[0] += a;
    state_[1] += b;
    state_[2] += c;
    state_[3] += d;
  }

  std::array<std::uint32_t, 4> state_ = {0x67452301, 0xefcdab89, 0x98badcfe, 0x10325476};
  std::uint64_t length_ = 0;
  Block buffer_{};
  std::size_t filled_ = 0;
};

}  // namespace

Digest md5(BytesView bytes) {
  MD5 digest;
  digest.add(bytes);
  return digest.finish();
}

Digest hmacMD5(BytesView key, BytesView message) {
  Block inner{};
  // A key is brought to the length of a block: a longer one as its digest, a shorter one with zeros.
  if (key.size() > blockSize) {
    const Digest shortened = md5(key);
    std::copy(shortened.begin(), shortened.end(), inner.begin());
  } else {
    std::copy(key.begin(), key.end(), inner.begin());
  }
  Block outer = inner;
  for (std::uint8_t& byte : inner) byte ^= 0x36;
  for (std::uint8_t& byte : outer) byte ^= 0x5c;

  MD5 innerDigest;
  innerDigest.add(inner);
  innerDigest.add(message);
  MD5 outerDigest;
  outerDigest.add(outer);
  outerDigest.add(innerDigest.finish());
  return outerDigest.finish();
}

}  // namespace kel::platform
