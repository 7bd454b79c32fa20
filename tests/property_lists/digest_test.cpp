#include "property_lists/digest.h"

#include <gtest/gtest.h>

#include "property_lists/property_list.h"

namespace kel::platform {
namespace {

Bytes bytesOf(std::string_view text) { return Bytes(text.begin(), text.end()); }
std::string print(const Digest& digest) { return describe(Bytes(digest.begin(), digest.end())); }

TEST(DigestTest, MD5AndHMACGiveThePublishedDigests) {
  EXPECT_EQ(print(md5({})), "<d41d8cd9 8f00b204 e9800998 ecf8427e>");
  EXPECT_EQ(print(md5(bytesOf("message digest"))), "<f96b697d 7cb7938d 525a2f31 aaf161d0>");
  EXPECT_EQ(print(hmacMD5(bytesOf("Jefe"), bytesOf("what do ya want for nothing?"))),
            "<750c783e 6ab0b503 eaa86e31 0a5db738>");
  EXPECT_EQ(print(hmacMD5(Bytes(16, 0xaa), Bytes(50, 0xdd))), "<56be3452 1d144c88 dbb8c733 f0e8b3f6>");
  const Bytes message = bytesOf("Test Using Larger Than Block-Size Key and Larger Than One Block-Size Data");
  EXPECT_EQ(print(hmacMD5(Bytes(80, 0xaa), message)), "<6f630fad 67cda0ee 1fb1f562 db3aa53e>");

  Bytes digests;  // Of every length up to two blocks and a bit.
  for (std::size_t length = 0; length < 130; ++length) {
    const Digest digest = md5(Bytes(length, 'x'));
    digests.insert(digests.end(), digest.begin(), digest.end());
  }
  EXPECT_EQ(print(md5(digests)), "<6c93ccf0 27822c47 aed4077b edd7e658>");
}

}  // namespace
}  // namespace kel::platform
