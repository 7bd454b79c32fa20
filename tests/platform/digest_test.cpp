#include "platform/digest.h"

#include <gtest/gtest.h>
#include <string>

namespace kel::platform {
namespace {

Bytes bytesOf(std::string_view text) { return Bytes(text.begin(), text.end()); }

std::string hexadecimal(const Digest& digest) {
  std::string text;
  for (const std::uint8_t byte : digest) {
    text += "0123456789abcdef"[byte >> 4];
    text += "0123456789abcdef"[byte & 0xF];
  }
  return text;
}

TEST(DigestTest, MD5GivesThePublishedDigests) {
  const std::pair<std::string, std::string> cases[] = {
      {"", "d41d8cd98f00b204e9800998ecf8427e"},
      {"a", "0cc175b9c0f1b6a831c399e269772661"},
      {"abc", "900150983cd24fb0d6963f7d28e17f72"},
      {"message digest", "f96b697d7cb7938d525a2f31aaf161d0"},
      {"abcdefghijklmnopqrstuvwxyz", "c3fcd3d76192e4007dfb496cca67e13b"},
      {"ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789", "d174ab98d277d9f5a5611c2c9f419d9f"},
      {"12345678901234567890123456789012345678901234567890123456789012345678901234567890",
       "57edf4a22be3c955ac49da2e2107b67a"},
  };
  for (const auto& [text, digest] : cases) EXPECT_EQ(hexadecimal(md5(bytesOf(text))), digest) << text;
}

TEST(DigestTest, MD5PadsEveryLengthAroundTheBlockSize) {
  // The digest of the digests of 0 to 129 bytes.
  Bytes digests;
  for (std::size_t length = 0; length < 130; ++length) {
    const Digest digest = md5(Bytes(length, 'x'));
    digests.insert(digests.end(), digest.begin(), digest.end());
  }
  EXPECT_EQ(hexadecimal(md5(digests)), "6c93ccf027822c47aed4077bedd7e658");
}

TEST(DigestTest, HMACGivesThePublishedDigests) {
  struct Case {
    Bytes key;
    Bytes message;
    std::string digest;
  };
  Bytes counting;
  for (std::uint8_t i = 1; i <= 25; ++i) counting.push_back(i);
  const Case cases[] = {
      {Bytes(16, 0x0b), bytesOf("Hi There"), "9294727a3638bb1c13f48ef8158bfc9d"},
      {bytesOf("Jefe"), bytesOf("what do ya want for nothing?"), "750c783e6ab0b503eaa86e310a5db738"},
      {Bytes(16, 0xaa), Bytes(50, 0xdd), "56be34521d144c88dbb8c733f0e8b3f6"},
      {counting, Bytes(50, 0xcd), "697eaf0aca3a3aea3a75164746ffaa79"},
      {Bytes(16, 0x0c), bytesOf("Test With Truncation"), "56461ef2342edc00f9bab995690efd4c"},
      {Bytes(80, 0xaa), bytesOf("Test Using Larger Than Block-Size Key - Hash Key First"),
       "6b1ab7fe4bd7bf8f0b62e6ce61b9d0cd"},
      {Bytes(80, 0xaa), bytesOf("Test Using Larger Than Block-Size Key and Larger Than One Block-Size Data"),
       "6f630fad67cda0ee1fb1f562db3aa53e"},
  };
  for (const Case& c : cases) EXPECT_EQ(hexadecimal(hmacMD5(c.key, c.message)), c.digest);
}

}  // namespace
}  // namespace kel::platform
