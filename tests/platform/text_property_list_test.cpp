#include <gmock/gmock.h>
#include <limits>
#include <random>

#include "platform/property_list.h"
#include "support/print.h"
#include "support/random_value.h"

namespace kel::platform {
namespace {

using namespace std::string_literals;
using testing::HasSubstr;

PropertyListDictionary dictionary(std::initializer_list<PropertyListDictionary::Entry> entries) {
  return PropertyListDictionary(std::vector<PropertyListDictionary::Entry>(entries));
}

PropertyListReading read(std::string_view text, const PropertyListLimits& limits = {}) {
  const Bytes copy(text.begin(), text.end());
  return readTextPropertyList(copy, limits);
}

TEST(TextPropertyListTest, EveryFormIsRead) {
  const PropertyListDictionary pair = dictionary({{"a", "b"}});
  const std::pair<std::string, PropertyListValue> cases[] = {
      {"", PropertyListDictionary()},
      {" // nothing\n/* at\nall */", PropertyListDictionary()},
      {"bare._/-:$09", "bare._/-:$09"},
      {"/usr/bin//comment", "/usr/bin"},
      {"a/*b*/", "a"},
      {"\"\"", ""},
      {"'it\\'s \"x\"'", "it's \"x\""},
      {R"("\n\t\r\a\b\f\v\"\'\\")", "\n\t\r\a\b\f\v\"'\\"},
      {"\"a\\\nb\"", "a\nb"},
      {R"("\0\101\1018\377")", "\0AA8\u00ff"s},
      {R"("\U00E9\Ud83d\UDE00x")", "\u00e9\U0001F600x"},
      {"\"// no /* comment\n\u00e9\"", "// no /* comment\n\u00e9"},
      {"<>", Bytes{}},
      {"< 0aFF\n1 2 >", Bytes{0x0A, 0xFF, 0x12}},
      {"()", PropertyListArray{}},
      {"(a, 'b' ,(c,),)", PropertyListArray{"a", "b", PropertyListArray{"c"}}},
      {"{}", PropertyListDictionary()},
      {"{a=b;}", pair},
      {"a=b;", pair},
      {"\xEF\xBB\xBF\"a\" /* is */ = 'b' ; // end", pair},
      {"\xFF\xFE"
       "a\0=\0b\0;\0"s,
       pair},
      {"\xFE\xFF"
       "\0a\0=\0b\0;"s,
       pair},
      {"{ a = {c; d = <00>;}; 'a' = b; }", pair},
      {"x; y = (1);", dictionary({{"x", "x"}, {"y", PropertyListArray{"1"}}})},
  };
  for (const auto& [text, value] : cases) {
    const PropertyListReading reading = read(text);
    ASSERT_EQ(reading.error, "") << text;
    EXPECT_EQ(*reading.value, value) << text;
  }
}

TEST(TextPropertyListTest, MalformedFilesAreRefusedWithThePlace) {
  const std::pair<std::string, std::string> cases[] = {
      {"a b", "line 1, column 3: '=' or ';' expected"},
      {"a =", "line 1, column 4: unexpected end"},
      {"a = b", "line 1, column 6: ';' expected"},
      {"a = b;\n}", "line 2, column 1: unexpected character"},
      {"{a = b}", "line 1, column 7: ';' expected"},
      {"{a = b;\n", "line 2, column 1: unexpected end"},
      {"{a = b;};", "line 1, column 9: the end expected"},
      {"{a b;}", "line 1, column 4: '=' or ';' expected"},
      {"{(a) = b;}", "line 1, column 2: unexpected character"},
      {"{<00> = b;}", "line 1, column 2: unexpected character"},
      {"(a b)", "line 1, column 4: ',' or ')' expected"},
      {"(,)", "line 1, column 2: unexpected character"},
      {"(a", "line 1, column 3: ',' or ')' expected"},
      {"(a})", "line 1, column 3: ',' or ')' expected"},
      {"(\n  \u00e9)", "line 2, column 3: unexpected character"},
      {"(a) b", "line 1, column 5: the end expected"},
      {"<0", "line 1, column 3: unterminated data"},
      {"<0>", "line 1, column 3: odd number of hexadecimal digits"},
      {"<0g>", "line 1, column 3: hexadecimal digit expected"},
      {"\"a", "line 1, column 1: unterminated string"},
      {"'a\\", "line 1, column 4: unexpected end"},
      {"\"\\q\"", "line 1, column 2: unknown escape"},
      {"\"\\400\"", "line 1, column 2: octal escape out of range"},
      {"\"\\U12\"", "line 1, column 6: hexadecimal digit expected"},
      {"\"\\UD83Dx\"", "line 1, column 2: lone surrogate"},
      {"\"\\UD83D\\U0041\"", "line 1, column 2: lone surrogate"},
      {"\"\\UDE00\"", "line 1, column 2: lone surrogate"},
      {"/* a", "line 1, column 1: unterminated comment"},
      {"/*/", "line 1, column 1: unterminated comment"},
      {"a = \"\xFF\";", "line 1, column 6: ill-formed UTF-8"},
  };
  for (const auto& [text, error] : cases) EXPECT_EQ(read(text).error, error) << text;
}

TEST(TextPropertyListTest, DepthAndSizeAreLimited) {
  EXPECT_EQ(read(std::string(512, '(') + std::string(512, ')')).value->depth(), 512U);
  EXPECT_EQ(read(std::string(513, '(')).error, "line 1, column 513: nested deeper than 512 levels");
  EXPECT_EQ(read("a = " + std::string(512, '(')).error, "line 1, column 516: nested deeper than 512 levels");
  EXPECT_EQ(read("key = (text);", {512, 8 + 11 + 8 + 12}).error, "");
  EXPECT_EQ(read("key = (text);", {512, 8 + 11 + 8 + 11}).error,
            "line 1, column 8: the value expands to more than 38 bytes");
}

TEST(PropertyListDescriptionTest, AValueIsRenderedInTheTextEncoding) {
  const PropertyListDictionary value = dictionary({
      {"array", PropertyListArray{1, PropertyListArray{}, PropertyListDictionary(), "x"}},
      {"boolean", PropertyListArray{true, false}},
      {"data", Bytes{0x01, 0x23, 0xAB, 0xCD, 0xEF}},
      {"date", PropertyListDate{730902896.75}},
      {"far date", PropertyListDate{1e300}},
      {"integer", PropertyListArray{UINT64_MAX, INT64_MIN}},
      {"real", PropertyListArray{0.1, 1e300, -2.0, std::numeric_limits<double>::infinity()}},
      {"strings",
       PropertyListArray{"", "a//b", "/a.b:c-d_e$", "a b", "\"\\\n\x1b\x7f\u0080\u00e9\U0001F600\xFF"}},
  });
  EXPECT_EQ(describe(value), R"({
    array = (
        1,
        (
        ),
        {
        },
        x
    );
    boolean = (
        1,
        0
    );
    data = <0123abcd ef>;
    date = 2024-02-29T12:34:56Z;
    "far date" = "1e+300";
    integer = (
        18446744073709551615,
        -9223372036854775808
    );
    real = (
        0.1,
        "1e+300",
        -2,
        inf
    );
    strings = (
        "",
        "a//b",
        /a.b:c-d_e$,
        "a b",
        "\"\\\n\033\177\200)"
                             "\u00e9\U0001F600\uFFFD\"\n    );\n}");
  EXPECT_EQ(describe(PropertyListDate{-1}), "2000-12-31T23:59:59Z");
  EXPECT_EQ(describe(PropertyListDate{-63113904000}), "0001-01-01T00:00:00Z");
  EXPECT_EQ(describe("bare"), "bare");
}

TEST(PropertyListDescriptionTest, WhatIsPrintedReadsBack) {
  std::mt19937 random(3);
  for (int round = 0; round < 300; ++round) {
    const std::string text = describe(randomValue(random, 3));
    const PropertyListReading reading = read(text);
    ASSERT_EQ(reading.error, "") << text;
    ASSERT_EQ(describe(*reading.value), text);
  }
}

TEST(PropertyListReaderTest, TheEncodingIsFoundByTheBeginning) {
  const std::pair<std::string, PropertyListValue> cases[] = {
      {" \n<!-- c --><true/>", true},
      {"<false/>", false},
      {"<?xml version='1.0'?><data/>", Bytes{}},
      {"<!DOCTYPE plist><date>2001-01-01T00:00:00Z</date>", PropertyListDate{0}},
      {"\xFF\xFE"
       "<\0t\0r\0u\0e\0/\0>\0"s,
       true},
      {"<abcdef>", Bytes{0xAB, 0xCD, 0xEF}},
      {" <ab cd>", Bytes{0xAB, 0xCD}},
      {"<00>", Bytes{0}},
      {"<>", Bytes{}},
      {"\"k\" = v;", dictionary({{"k", "v"}})},
      {"bplist", "bplist"},
      {"", PropertyListDictionary()},
      {"bplist00\x09\x08\0\0\0\0\0\0\1\1\0\0\0\0\0\0\0\1\0\0\0\0\0\0\0\0\0\0\0\0\0\0\0\x09"s, true},
  };
  for (const auto& [text, value] : cases) {
    const PropertyListReading reading = readPropertyList(Bytes(text.begin(), text.end()));
    ASSERT_EQ(reading.error, "") << text;
    EXPECT_EQ(*reading.value, value) << text;
  }
}

}  // namespace
}  // namespace kel::platform
