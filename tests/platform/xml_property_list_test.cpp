#include <cmath>
#include <gmock/gmock.h>
#include <limits>

#include "platform/property_list.h"
#include "support/print.h"

namespace kel::platform {
namespace {

using namespace std::string_literals;
using testing::HasSubstr;

PropertyListDictionary dictionary(std::initializer_list<PropertyListDictionary::Entry> entries) {
  return PropertyListDictionary(std::vector<PropertyListDictionary::Entry>(entries));
}

PropertyListReading read(std::string_view text, const PropertyListLimits& limits = {}) {
  const Bytes copy(text.begin(), text.end());
  return readXMLPropertyList(copy, limits);
}

std::string utf16(std::string_view ascii, bool bigEndian) {
  std::string text = bigEndian ? "\xFE\xFF" : "\xFF\xFE";
  for (const char c : ascii) text += bigEndian ? std::string{'\0', c} : std::string{c, '\0'};
  return text;
}

TEST(XMLPropertyListTest, EveryValueIsRead) {
  const std::pair<std::string, PropertyListValue> cases[] = {
      {"<true/>", true},
      {"<false ></false >", false},
      {"<integer> 42\n</integer>", 42},
      {"<integer>-0x10</integer>", -16},
      {"<integer>+7</integer>", 7},
      {"<integer>-0</integer>", 0},
      {"<integer>18446744073709551615</integer>", UINT64_MAX},
      {"<integer>-9223372036854775808</integer>", INT64_MIN},
      {"<real>-1.25e2</real>", -125.0},
      {"<real>+.5</real>", 0.5},
      {"<real>-inf</real>", -std::numeric_limits<double>::infinity()},
      {"<real>+Infinity</real>", std::numeric_limits<double>::infinity()},
      {"<date>2001-01-01T00:00:00Z</date>", PropertyListDate{0}},
      {"<date>2024-02-29T12:34:56Z</date>", PropertyListDate{730902896}},
      {"<date>1970-01-01T00:00:00Z</date>", PropertyListDate{-978307200}},
      {"<data>\n\tAAEC /w==\n</data>", Bytes{0, 1, 2, 255}},
      {"<data>+/A=</data>", Bytes{0xFB, 0xF0}},
      {"<data/>", Bytes{}},
      {"<string/>", ""},
      {"<string> a\tb </string>", " a\tb "},
      {"<string>&lt;&amp;&gt;&apos;&quot;&#65;&#x1F600;&#13;</string>", "<&>'\"A\U0001F600\r"},
      {"<string>a<![CDATA[<&lt;]]]>b<!-- c -->d<?e f?>]]</string>", "a<&lt;]bd]]"},
      {"<string>1\r\n2\r3<![CDATA[\r\n4\r]]></string>", "1\n2\n3\n4\n"},
      {"<string>\u00e9\uFFFD\uE000</string>", "\u00e9\uFFFD\uE000"},
      {"<array/>", PropertyListArray{}},
      {"<array a='&amp;>' b:c = \"'\"><!-- x --><true/> <?p?><array></array></array >",
       PropertyListArray{true, PropertyListArray{}}},
      {"<dict><key>b</key><true/><key/><dict/></dict>",
       dictionary({{"b", true}, {"", PropertyListDictionary()}})},
      {"<dict><key>a</key><integer>1</integer><key>a</key><integer>2</integer></dict>",
       dictionary({{"a", 2}})},
  };
  const std::string prologs[] = {
      "<plist version=\"1.0\">", "\xEF\xBB\xBF<?xml version='1.0' encoding=\"utf-8\" ?>\n<plist>",
      "<!-- - --><!DOCTYPE plist [<!ENTITY e ']>'> <!-- ]> ' --> <?p ]> ?>]>\n<plist>"};
  for (const auto& [text, value] : cases) {
    for (const std::string& prolog : prologs) {
      const PropertyListReading reading = read(prolog + "\n" + text + "</plist>\n<!-- end -->");
      ASSERT_EQ(reading.error, "") << text;
      EXPECT_EQ(*reading.value, value) << text;
    }
    EXPECT_EQ(read(text).value, value) << "without a root around it: " << text;
  }
  EXPECT_TRUE(std::isnan(*read("<real>nan</real>").value->asReal()));
}

TEST(XMLPropertyListTest, MarkedUTF16IsReadInEitherOrder) {
  const std::string document = "<?xml version=\"1.0\" encoding=\"UTF-16\"?><string>text</string>";
  for (const bool bigEndian : {false, true}) {
    const std::string text = utf16(document, bigEndian);
    EXPECT_EQ(read(text).value, PropertyListValue("text"));
    EXPECT_THAT(read(text.substr(0, text.size() - 1)).error, HasSubstr("says UTF-16"));
  }
}

TEST(XMLPropertyListTest, MalformedFilesAreRefusedWithThePlace) {
  const std::pair<std::string, std::string> cases[] = {
      {"", "line 1, column 1: unexpected end"},
      {"<plist>\n  \u00e9 <true/></plist>", "line 2, column 3: text outside of an element"},
      {"<plist></plist>", "line 1, column 8: a value expected"},
      {"<plist/>", "line 1, column 9: a value expected"},
      {"<plist><plist><true/></plist></plist>", "line 1, column 8: a value expected"},
      {"<plist><true/><true/></plist>", "line 1, column 15: another end tag expected"},
      {"<plist><true/>", "line 1, column 15: unexpected end"},
      {"<true/>x", "line 1, column 8: the end expected"},
      {"<true/>\n<true/>", "line 2, column 1: the end expected"},
      {"<key>a</key>", "line 1, column 1: a value expected"},
      {"<Array/>", "line 1, column 1: unknown element"},
      {"<arrays/>", "line 1, column 1: unknown element"},
      {"<array", "line 1, column 7: malformed tag"},
      {"<array>\n<true/>\n", "line 3, column 1: unexpected end"},
      {"<array>\n<true/>\n</dict>", "line 3, column 1: another end tag expected"},
      {"<array>text</array>", "line 1, column 8: text outside of an element"},
      {"<array><![CDATA[ ]]></array>", "line 1, column 9: a name expected"},
      {"<array/ >", "line 1, column 8: malformed tag"},
      {"<array a></array>", "line 1, column 9: '=' expected"},
      {"<array a=b></array>", "line 1, column 10: a quoted value expected"},
      {"<array a='b></array>", "line 1, column 13: \"<\" in an attribute"},
      {"<array a='&b;'/>", "line 1, column 11: unknown entity"},
      {"<dict><string>a</string></dict>", "line 1, column 7: a key expected"},
      {"<dict><key>a</key></dict>", "line 1, column 19: a key without a value"},
      {"<dict><key>a</key><key>b</key></dict>", "line 1, column 19: a value expected"},
      {"<string>a<b/></string>", "line 1, column 10: an element where text is expected"},
      {"<string>a</strings>", "line 1, column 10: another end tag expected"},
      {"<string>a", "line 1, column 10: unexpected end"},
      {"<string>&e;</string>", "line 1, column 9: unknown entity"},
      {"<!DOCTYPE plist [<!ENTITY e 'x'>]><string>&e;</string>", "line 1, column 43: unknown entity"},
      {"<string>&amp</string>", "line 1, column 9: unterminated reference"},
      {"<string>&#0;</string>", "line 1, column 9: a character that XML does not allow"},
      {"<string>&#xD800;</string>", "line 1, column 9: a character that XML does not allow"},
      {"<string>&#x100000041;</string>", "line 1, column 9: a character that XML does not allow"},
      {"<string>&#;</string>", "line 1, column 9: malformed character reference"},
      {"<string>&#A;</string>", "line 1, column 9: malformed character reference"},
      {"<string>]]></string>", "line 1, column 9: \"]]>\" outside of a CDATA section"},
      {"<string>\x01</string>", "line 1, column 9: a character that XML does not allow"},
      {"<string>\0</string>"s, "line 1, column 9: a character that XML does not allow"},
      {"<string>\uFFFF</string>", "line 1, column 9: a character that XML does not allow"},
      {"<string>\u00e9\xC3</string>", "line 1, column 10: ill-formed UTF-8"},
      {"<string><![CDATA[</string>", "line 1, column 18: unterminated CDATA section"},
      {"<true>1</true>", "line 1, column 1: a boolean with contents"},
      {"<!-- a -- b --><true/>", "line 1, column 1: a comment with \"--\" inside or without an end"},
      {"<!-- a", "line 1, column 5: unterminated comment"},
      {" <?xml version='1.0'?><true/>", "line 1, column 2: an XML declaration that is not at the beginning"},
      {"<?xml encoding='UTF-8'?><true/>", "line 1, column 7: malformed XML declaration"},
      {"<?xml version='2.0'?><true/>", "line 1, column 7: unknown XML version"},
      {"<?xml version='1.0' encoding='ISO-8859-1'?><true/>", "line 1, column 21: unsupported encoding"},
      {"<?p", "line 1, column 4: malformed processing instruction"},
      {"<!DOCTYPE plist SYSTEM 'x><true/>", "line 1, column 25: unterminated literal"},
      {"<!DOCTYPE plist [ ><true/>", "line 1, column 10: unterminated document type"},
      {"<!DOCTYPE a><!DOCTYPE b><true/>", "line 1, column 14: a name expected"},
  };
  for (const auto& [text, error] : cases) EXPECT_EQ(read(text).error, error) << text;

  const std::pair<std::string, std::vector<std::string>> leaves[] = {
      {"integer",
       {"", "x", "1 2", "--1", "+-1", "0x", "1.5", "18446744073709551616", "-9223372036854775809"}},
      {"real", {"", "x", "1,5", "+-1", "0x1p3", "1e999", "nan(1)", "1 2"}},
      {"date",
       {"", "2024-02-30T00:00:00Z", "2024-01-01T24:00:00Z", "2024-01-01T00:60:00Z", "2024-01-01T00:00:60Z",
        "2024-00-01T00:00:00Z", "2024-01-01T00:00:00", "2024-01-01 00:00:00Z", "24-01-01T00:00:00Z"}},
      {"data", {"A", "AA", "AAA", "AA=A", "A===", "====", "AA==AAAA", "AAA==", "AAA=====", "AA*="}},
  };
  for (const auto& [name, texts] : leaves) {
    for (const std::string& text : texts) {
      EXPECT_THAT(read("<" + name + ">" + text + "</" + name + ">").error, HasSubstr("line 1, column 1: no "))
          << name << " " << text;
    }
  }
}

TEST(XMLPropertyListTest, DepthAndSizeAreLimited) {
  const auto nested = [](int levels) {
    std::string text;
    for (int i = 0; i < levels; ++i) text += "<array>";
    for (int i = 0; i < levels; ++i) text += "</array>";
    return text;
  };
  EXPECT_EQ(read(nested(512)).value->depth(), 512U);
  EXPECT_EQ(read(nested(513)).error, "line 1, column 3585: nested deeper than 512 levels");
  EXPECT_THAT(read(nested(1'000'000)).error, HasSubstr("nested deeper than 512 levels"));

  const std::string text = "<dict><key>key</key><array><string>text</string></array></dict>";
  const std::uint64_t expanded = read(text).value->expandedSize();
  EXPECT_EQ(read(text, {512, expanded}).error, "");
  EXPECT_THAT(read(text, {512, expanded - 1}).error, HasSubstr("the value expands to more than"));
}

TEST(XMLPropertyListTest, RepeatedStringsOfAFileAreShared) {
  const PropertyListReading reading =
      read("<array><string>same</string><string>other</string><string>same</string></array>");
  const PropertyListArray& array = *reading.value->asArray();
  EXPECT_EQ(array[0].asString(), array[2].asString());
}

TEST(XMLPropertyListTest, DamageNeverReadsOutOfBounds) {
  const std::string text =
      "<?xml version='1.0'?><!DOCTYPE p [<!-- -->]><plist "
      "version='1.0'><dict><key>a&amp;b</key><array><true/>"
      "<integer>12</integer><real>1.5</real><data>AAEC</data><date>2024-02-29T12:34:56Z</date></"
      "array><key>c</key>"
      "<string>x<![CDATA[y]]>&#65;\u00e9</string></dict></plist>";
  for (std::size_t length = 0; length < text.size(); ++length) {
    EXPECT_NE(read(std::string_view(text).substr(0, length)).error, "") << length;
    for (const char c : {'<', '>', '/', '&', ';', '"', '!', '-', ']', '\0', '\xE9'}) {
      std::string damaged = text;
      damaged[length] = c;
      const PropertyListReading reading = read(damaged);
      EXPECT_NE(reading.value.has_value(), !reading.error.empty());
    }
  }
}

}  // namespace
}  // namespace kel::platform
