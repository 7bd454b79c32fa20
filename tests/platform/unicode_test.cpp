#include "platform/unicode.h"

#include <gmock/gmock.h>

namespace kel::platform {
namespace {

using testing::ElementsAre;

std::vector<char32_t> characters(std::string_view text) {
  std::vector<char32_t> all;
  for (std::size_t position = 0; position < text.size();) all.push_back(nextCharacter(text, position));
  return all;
}

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
}

TEST(UnicodeTest, IllFormedBytesAreRefusedWhereverTheyStandAndDecodedOneByOne) {
  const std::string illFormed[] = {
      "\x80",         "\xC0\x80",         "\xC1\xBF",         "\xE0\x9F\xBF",     "\xED\xA0\x80",
      "\xED\xBF\xBF", "\xF0\x8F\xBF\xBF", "\xF4\x90\x80\x80", "\xF5\x80\x80\x80", "\xFF",
      "\xC3",         "\xE2\x82",         "\xF0\x9F\x98"};
  for (const std::string& bytes : illFormed) {
    for (std::size_t before = 0; before < 18; ++before) {
      const std::string text = std::string(before, 'a') + bytes + "abcdefgh";
      EXPECT_FALSE(isValidUTF8(text)) << testing::PrintToString(text);
      EXPECT_EQ(characters(text).size(), text.size()) << testing::PrintToString(text);
    }
    EXPECT_FALSE(isValidUTF8("\u00e9" + bytes)) << "at the end";
  }
  EXPECT_THAT(characters("a\xE2\x82z"), ElementsAre(U'a', 0xFFFD, 0xFFFD, U'z'));
  std::string text;
  appendUTF8(text, 0xD800);
  appendUTF8(text, 0x110000);
  EXPECT_EQ(text, "\uFFFD\uFFFD");
}

TEST(UnicodeTest, UTF16CountsAndWritesSurrogatePairs) {
  EXPECT_EQ(utf16Length("a\u00e9\U0001F600\xFF"), 5U);
  EXPECT_THAT(utf16LittleEndianWithMark("a\u4f60\U0001F600"),
              ElementsAre(0xFF, 0xFE, 'a', 0, 0x60, 0x4F, 0x3D, 0xD8, 0x00, 0xDE));
}

TEST(UnicodeTest, UTF16IsReadInEitherOrderAndRefusedWhenASurrogateStandsAlone) {
  const auto read = [](Bytes units, bool bigEndian) { return utf8FromUTF16(units, bigEndian); };
  EXPECT_EQ(read({0, 'a', 0xD8, 0x3D, 0xDE, 0x00, 0xFF, 0xFF}, true), "a\U0001F600\uFFFF");
  EXPECT_EQ(read({'a', 0, 0x3D, 0xD8, 0x00, 0xDE}, false), "a\U0001F600");
  EXPECT_EQ(read({}, true), "");
  for (const Bytes& units : {Bytes{0xD8, 0x3D}, Bytes{0xDE, 0, 0, 'a'}, Bytes{0xD8, 0, 0, 'a'},
                             Bytes{0xD8, 0, 0xD8, 0}, Bytes{0, 'a', 0}}) {
    EXPECT_EQ(read(units, true), std::nullopt) << testing::PrintToString(units);
  }
}

TEST(UnicodeTest, LowerCaseFollowsTheFullMapping) {
  const std::pair<std::string, std::string> cases[] = {
      {"ABC xyz 012", "abc xyz 012"},
      {"\u00c4\u00d6\u00d7\u00df", "\u00e4\u00f6\u00d7\u00df"},
      {"\u0130", "i\u0307"},
      {"\u212a\u212b\u2126", "k\u00e5\u03c9"},
      {"\u0100\u0101\u0139\u013a\u0178", "\u0101\u0101\u013a\u013a\u00ff"},
      {"\u03a3\u03a3", "\u03c3\u03c3"},
      {"\u1e9e\u01c4\u01c5", "\u00df\u01c6\u01c6"},
      {"\u13a0\u10a0\u2c2f\ua64a", "\uab70\u2d00\u2c5f\ua64b"},
      {"\U00010400\U0001E921", "\U00010428\U0001E943"},
      {"A\xFFZ", "a\xFFz"},
  };
  for (const auto& [text, lower] : cases) {
    EXPECT_EQ(lowerCase(text), lower);
    EXPECT_EQ(lowerCase(lower), lower);
  }
}

}  // namespace
}  // namespace kel::platform
