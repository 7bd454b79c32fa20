#include "property_lists/unicode.h"

#include <gmock/gmock.h>

namespace kel::platform {
namespace {

using testing::ElementsAre;

TEST(UnicodeTest, EveryScalarValueSurvivesEncodingAndDecoding) {
  for (char32_t character = 0; character <= 0x10FFFF; ++character) {
    if (character == 0xD800) character = 0xE000;
    std::string text;
    appendUTF8(text, character);
    std::size_t position = 0;
    ASSERT_EQ(nextCharacter(text, position), character);
    ASSERT_EQ(position, text.size());
    ASSERT_TRUE(isValidUTF8(text));
  }
  std::string text;
  appendUTF8(text, 0xD800);
  appendUTF8(text, 0x110000);
  EXPECT_EQ(text, "\uFFFD\uFFFD");
}

TEST(UnicodeTest, IllFormedBytesAreRefusedWhereverTheyStandAndDecodedOneByOne) {
  for (const std::string bytes :
       {"\x80", "\xC0\x80", "\xC1\xBF", "\xE0\x9F\xBF", "\xED\xA0\x80", "\xED\xBF\xBF", "\xF0\x8F\xBF\xBF",
        "\xF4\x90\x80\x80", "\xF5\x80\x80\x80", "\xFF", "\xC3", "\xE2\x82", "\xF0\x9F\x98"}) {
    for (std::size_t before = 0; before < 18; ++before) {
      const std::string text = std::string(before, 'a') + bytes + "abcdefgh";
      EXPECT_FALSE(isValidUTF8(text)) << testing::PrintToString(text);
      for (std::size_t position = 0, character = 0; position < text.size(); ++character) {
        const bool isBad = character >= before && character < before + bytes.size();
        EXPECT_EQ(nextCharacter(text, position), isBad ? 0xFFFD : static_cast<char32_t>(text[character]));
      }
    }
    EXPECT_FALSE(isValidUTF8("\u00e9" + bytes)) << "at the end";
  }
}

TEST(UnicodeTest, UTF16HasSurrogatePairsAndNoneStandsAlone) {
  EXPECT_EQ(utf16Length("a\u00e9\U0001F600\xFF"), 5U);
  EXPECT_THAT(utf16LittleEndianWithMark("a\u4f60\U0001F600"),
              ElementsAre(0xFF, 0xFE, 'a', 0, 0x60, 0x4F, 0x3D, 0xD8, 0x00, 0xDE));
  EXPECT_EQ(utf8FromUTF16(Bytes{0, 'a', 0xD8, 0x3D, 0xDE, 0, 0xFF, 0xFF}, true), "a\U0001F600\uFFFF");
  EXPECT_EQ(utf8FromUTF16(Bytes{'a', 0, 0x3D, 0xD8, 0, 0xDE}, false), "a\U0001F600");
  for (const Bytes& units : {Bytes{0xD8, 0x3D}, Bytes{0xDE, 0, 0, 'a'}, Bytes{0xD8, 0, 0, 'a'},
                             Bytes{0xD8, 0, 0xD8, 0}, Bytes{0, 'a', 0}}) {
    EXPECT_EQ(utf8FromUTF16(units, true), std::nullopt) << testing::PrintToString(units);
  }
}

TEST(UnicodeTest, LowerCaseFollowsTheFullMapping) {
  const std::string lower =
      "abc xyz 012 a\xFFz \u00e4\u00f6\u00d7\u00df i\u0307 k\u00e5\u03c9 \u0101\u0101\u013a\u013a\u00ff "
      "\u03c3\u03c3\u00df\u01c6\u01c6 \uab70\u2d00\u2c5f\ua64b\U00010428\U0001E943";
  EXPECT_EQ(lowerCase("ABC xyz 012 A\xFFZ \u00c4\u00d6\u00d7\u00df \u0130 \u212a\u212b\u2126 "
                      "\u0100\u0101\u0139\u013a\u0178 "
                      "\u03a3\u03a3\u1e9e\u01c4\u01c5 \u13a0\u10a0\u2c2f\ua64a\U00010400\U0001E921"),
            lower);
  EXPECT_EQ(lowerCase(lower), lower);
}

}  // namespace
}  // namespace kel::platform
