// The two encodings that people write, text and XML, and the choice among all three.

#include <algorithm>
#include <limits>

#include "property_lists/property_list.h"
#include "support/property_lists.h"

namespace kel::platform {
namespace {

using namespace std::string_literals;
using namespace test;
using namespace testing;
using Reader = PropertyListReading (*)(BytesView bytes, const PropertyListLimits& limits);

constexpr Reader text = readTextPropertyList;
constexpr Reader xml = readXMLPropertyList;
constexpr double infinity = std::numeric_limits<double>::infinity();

PropertyListReading read(Reader reader, std::string_view file, const PropertyListLimits& limits = {}) {
  // An exact copy on the heap lets the address sanitizer see a read behind the end.
  return reader(Bytes(file.begin(), file.end()), limits);
}

std::string utf16(std::string_view ascii, bool bigEndian) {
  std::string file = bigEndian ? "\xFE\xFF" : "\xFF\xFE";
  for (const char c : ascii) file += bigEndian ? std::string{'\0', c} : std::string{c, '\0'};
  return file;
}

/// Expects an error in each of `files`, where its "|" is.
template <typename... File>
void expectErrors(Reader reader, const File&... files) {
  for (std::string file : listOf<std::string>(files...)) {
    const std::string before = file.substr(0, file.find('|'));
    const std::string_view line = std::string_view(before).substr(before.rfind('\n') + 1);
    const auto lines = 1 + std::count(before.begin(), before.end(), '\n');
    const auto column =
        1 + std::count_if(line.begin(), line.end(), [](char c) { return (c & 0xC0) != 0x80; });
    EXPECT_THAT(read(reader, file.erase(before.size(), 1)).error,
                StartsWith("line " + std::to_string(lines) + ", column " + std::to_string(column) + ": "))
        << file;
  }
}

TEST(TextPropertyListTest, EveryFormIsRead) {
  const std::string strings =
      R"((bare._/-:$09, 'b' ,a/*b*/, "", "\n\t\r\a\b\f\v\"\'\\", 'it\'s "x"', "\0\101\1018\377",
      "\U00E9\Ud83d\UDE00x", "// no /* comment)"
      "\n\u00e9\", 'a\\\nb', <>, < 0aFF\n1 2 >, (c,),\n(), {})";
  const Array values = listOf<Value>("bare._/-:$09", "b", "a", "", "\n\t\r\a\b\f\v\"'\\", "it's \"x\"",
                                     "\0AA8\u00ff"s, "\u00e9\U0001F600x", "// no /* comment\n\u00e9", "a\nb",
                                     Bytes{}, Bytes{0x0A, 0xFF, 0x12}, Array{"c"}, Array{}, Dictionary());
  EXPECT_EQ(read(text, strings).value, Value(values));
  EXPECT_EQ(read(text, "/usr/bin//comment").value, Value("/usr/bin"));
  EXPECT_EQ(read(text, " // nothing\n/* at\nall */").value, Value(Dictionary()));
  EXPECT_EQ(read(text, "x; y = (1);").value, Value(dictionary({{"x", "x"}, {"y", Array{"1"}}})));
  for (const std::string& file :
       listOf<std::string>("{a=b;}", "a=b;", "\xEF\xBB\xBF\"a\" /* is */ = 'b' ; // end",
                           utf16("a=b;", false), utf16("a=b;", true), "{ a = {c; d = <00>;}; 'a' = b; }"))
    EXPECT_EQ(read(text, file).value, Value(dictionary({{"a", "b"}}))) << file;
}

TEST(TextPropertyListTest, MalformedFilesAreRefusedWithThePlace) {
  expectErrors(text, "a |b", "{a |b;}", "a = b|", "{a = b|}", "(a |b)", "(a|", "(a|})", "{a = b;}|;",
               "(a) |b", "a =|", "{a = b;\n|", "'a\\|", "a = b;\n|}", "{|(a) = b;}", "{|<00> = b;}", "(|,)",
               "(\n  |\u00e9)", "<0|", "<0|>", "<0|g>", "\"\\U12|\"", "|\"a", "|/* a", "|/*/", "\"|\\q\"",
               "\"|\\400\"", "\"|\\UD83Dx\"", "\"|\\UD83D\\U0041\"", "\"|\\UDE00\"", "a = \"|\xFF\";",
               std::string(512, '(') + "|(", "a = " + std::string(511, '(') + "|(");
}

TEST(XMLPropertyListTest, EveryValueIsRead) {
  const std::string elements =
      "<true/><false ></false ><integer> 42\n</integer><integer>-0x10</integer><integer>+7</integer>"
      "<integer>18446744073709551615</integer><integer>-9223372036854775808</integer><real>-1.25e2</real>"
      "<real>+.5</real><real>-inf</real><real>+Infinity</real><date>2024-02-29T12:34:56Z</date>"
      "<date>1970-01-01T00:00:00Z</date><data>\n\tAAEC /w==\n</data><data>+/A=</data><data/><string/>"
      "<string> a\tb </string><string>\u00e9\uFFFD\uE000</string>"
      "<string>&lt;&amp;&gt;&apos;&quot;&#65;&#x1F600;&#13;</string>"
      "<string>1\r\n2\r3<![CDATA[\r\n4\r]]></string><string>a<![CDATA[<&lt;]]]>b<!-- c -->d<?e f?>]]</string>"
      "<array a='&amp;>' b:c = \"'\"><!-- x --><true/> <?p?><array></array></array ><array/>"
      "<dict><key>b</key><true/><key/><dict/><key>b</key><integer>2</integer></dict>";
  const Value values = listOf<Value>(
      true, false, 42, -16, 7, UINT64_MAX, INT64_MIN, -125.0, 0.5, -infinity, infinity,
      PropertyListDate{730902896}, PropertyListDate{-978307200}, Bytes{0, 1, 2, 255}, Bytes{0xFB, 0xF0},
      Bytes{}, "", " a\tb ", "\u00e9\uFFFD\uE000", "<&>'\"A\U0001F600\r", "1\n2\n3\n4\n", "a<&lt;]bd]]",
      Array{true, Array{}}, Array{}, dictionary({{"b", 2}, {"", Dictionary()}}));
  for (const std::string prolog :
       {"<plist version=\"1.0\">", "\xEF\xBB\xBF<?xml version='1.0' encoding=\"utf-8\" ?>\n<plist>",
        "<!-- - --><!DOCTYPE plist [<!ENTITY e ']>'> <!-- ]> ' --> <?p ]> ?>]>\n<plist>"})
    EXPECT_EQ(read(xml, prolog + "\n<array>" + elements + "</array></plist>\n<!-- end -->").value, values);
  const Array same = *read(xml, "<array><string>same</string><string>same</string></array>").value->asArray();
  EXPECT_EQ(same[0].asString(), same[1].asString()) << "repeated strings are shared";
  for (const bool bigEndian : {false, true}) {
    const std::string file = utf16("<?xml version='1.0' encoding='UTF-16'?><data/>", bigEndian);
    EXPECT_EQ(read(xml, file).value, Value(Bytes{}));
    EXPECT_THAT(read(xml, file.substr(0, file.size() - 1)).error, HasSubstr("says UTF-16"));
  }
}

TEST(XMLPropertyListTest, MalformedFilesAreRefusedWithThePlace) {
  std::string deep;
  for (int level = 0; level < 512; ++level) deep += "<array>";
  expectErrors(xml, "|", "<plist><true/>|", "<array>\n<true/>\n|", "<plist>\n  |\u00e9 <true/></plist>",
               "<array>|text</array>", "<plist>|</plist>", "<plist>|<plist><true/></plist></plist>",
               "|<key>a</key>", "<dict><key>a</key>|<key>b</key></dict>", "<plist><true/>|<true/></plist>",
               "<array>\n<true/>\n|</dict>", "<string>a|</strings>", "<true/>\n|<true/>", "|<Array/>",
               "<array|", "<array/| >", "<array><|![CDATA[ ]]></array>", "<!DOCTYPE a><|!DOCTYPE b><true/>",
               "<array a|></array>", "<array a=|b></array>", "<array a='b>|</array>", "<array a='|&b;'/>",
               "<!DOCTYPE plist [<!ENTITY e 'x'>]><string>|&e;</string>", "<dict>|<string>a</string></dict>",
               "<dict><key>a</key>|</dict>", "<string>a|<b/></string>", "<string>|&amp</string>",
               "<string>|&#0;</string>", "<string>|&#xD800;</string>", "<string>|&#x100000041;</string>",
               "<string>|\x01</string>", "<string>|\0</string>"s, "<string>|\uFFFF</string>",
               "<string>|&#;</string>", "<string>|]]></string>", "<string>\u00e9|\xC3</string>",
               "<string><![CDATA[|</string>", "|<true>1</true>", "|<!-- a -- b --><true/>", "<!--| a",
               " |<?xml version='1.0'?><true/>", "<?xml |encoding='UTF-8'?><true/>",
               "<?xml |version='2.0'?><true/>", "<?xml version='1.0' |encoding='ISO-8859-1'?><true/>", "<?p|",
               "<!DOCTYPE plist SYSTEM '|x><true/>", "<!DOCTYPE| plist [ ><true/>", deep + "|<array>");

  for (const std::string& leaf : listOf<std::string>(
           "integer>", "integer>x", "integer>1 2", "integer>--1", "integer>+-1", "integer>0x", "integer>1.5",
           "integer>18446744073709551616", "integer>-9223372036854775809", "real>", "real>1,5", "real>+-1",
           "real>0x1p3", "real>1e999", "real>nan(1)", "real>1 2", "date>", "date>2024-02-30T00:00:00Z",
           "date>2024-01-01T24:00:00Z", "date>2024-01-01T00:60:00Z", "date>2024-01-01T00:00:60Z",
           "date>2024-00-01T00:00:00Z", "date>2024-01-01T00:00:00", "date>2024-01-01 00:00:00Z",
           "date>24-01-01T00:00:00Z", "data>A", "data>AA", "data>AAA", "data>AA=A",
           "data>A===", "data>====", "data>AA==AAAA", "data>AAA==", "data>AA*="))
    expectErrors(xml, "|<" + leaf + "</" + leaf.substr(0, leaf.find('>') + 1));
}

TEST(TextPropertyListTest, DepthAndSizeAreLimitedInBothEncodings) {
  std::string deep;
  for (int level = 0; level < 512; ++level) deep = "<array>" + deep + "</array>";
  EXPECT_EQ(read(xml, deep).value->depth(), 512U);
  EXPECT_EQ(read(text, std::string(512, '(') + std::string(512, ')')).value->depth(), 512U);
  constexpr std::uint64_t expanded = 8 + 11 + 8 + 12;
  const std::pair<Reader, std::string> files[] = {
      {text, "key = (text);"}, {xml, "<dict><key>key</key><array><string>text</string></array></dict>"}};
  for (const auto& [reader, file] : files) {
    EXPECT_EQ(read(reader, file, {512, expanded}).error, "");
    EXPECT_THAT(read(reader, file, {512, expanded - 1}).error,
                HasSubstr("the value expands to more than 38 bytes"));
  }
}

TEST(TextPropertyListTest, DamageNeverReadsOutOfBounds) {
  const std::pair<Reader, std::string> cases[] = {
      {text, R"({a = (b, "\U00e9\101\n", 'c'); /* d */ "e f" = {g; h = <00ff>;};})"},
      {xml,
       "<?xml version='1.0'?><!DOCTYPE p [<!-- -->]><plist a='1'><dict><key>a&amp;b</key><array><true/>"
       "<integer>12</integer><real>1.5</real><data>AAEC</data><date>2024-02-29T12:34:56Z</date></array>"
       "<key>c</key><string>x<![CDATA[y]]>&#65;\u00e9</string></dict></plist>"}};
  for (const auto& [reader, file] : cases) {
    ASSERT_EQ(read(reader, file).error, "");
    for (std::size_t length = 1; length < file.size(); ++length) {
      EXPECT_NE(read(reader, std::string_view(file).substr(0, length)).error, "") << length;
      for (const char c : "<>/&;\"!-]\\*=\xE9") {
        std::string damaged = file;
        damaged[length] = c;
        const PropertyListReading reading = read(reader, damaged);
        EXPECT_NE(reading.value.has_value(), !reading.error.empty());
      }
    }
  }
}

TEST(PropertyListDescriptionTest, AValueIsRenderedInTheTextEncoding) {
  const Value nested = dictionary({{"a b", Array{1, Array{}, Dictionary()}}, {"c", "x"}});
  EXPECT_EQ(
      describe(nested),
      "{\n    \"a b\" = (\n        1,\n        (\n        ),\n        {\n        }\n    );\n    c = x;\n}");
  const Array values = listOf<Value>(
      true, false, UINT64_MAX, INT64_MIN, 0.1, 1e300, -2.0, infinity, Bytes{0x01, 0x23, 0xAB, 0xCD, 0xEF},
      PropertyListDate{730902896.75}, PropertyListDate{-1}, PropertyListDate{-63113904000},
      PropertyListDate{1e300}, "", "a//b", "/a.b:c-d_e$", "a b", "\"\\\n\x1b\x7f\u0080\u00e9\U0001F600\xFF");
  const auto texts =
      listOf<std::string>("1", "0", "18446744073709551615", "-9223372036854775808", "0.1", "\"1e+300\"", "-2",
                          "inf", "<0123abcd ef>", "2024-02-29T12:34:56Z", "2000-12-31T23:59:59Z",
                          "0001-01-01T00:00:00Z", "\"1e+300\"", "\"\"", "\"a//b\"", "/a.b:c-d_e$", "\"a b\"",
                          R"("\"\\\n\033\177\200)"
                          "\u00e9\U0001F600\uFFFD\"");
  for (std::size_t i = 0; i < values.size(); ++i) EXPECT_EQ(describe(values[i]), texts.at(i));

  Value deep = Array(50'000, Value("\u00e9"));
  for (int level = 0; level < 500; ++level) deep = Array{deep};
  EXPECT_EQ(describeBriefly(deep, 4096).size(), 4096 + std::string_view(" [cut]").size());
  EXPECT_EQ(describeBriefly("\u00e9", 2), "\" [cut]") << "cut within a character";
}

TEST(PropertyListReaderTest, TheEncodingIsFoundByTheBeginning) {
  for (const std::string& file : listOf<std::string>(
           " \n<!-- c --><true/>", "<true/>", "<?xml version='1.0'?><true/>", "<!DOCTYPE plist><true/>",
           utf16("<true/>", false),
           "bplist00\x09\x08\0\0\0\0\0\0\1\1\0\0\0\0\0\0\0\1\0\0\0\0\0\0\0\0\0\0\0\0\0\0\0\x09"s))
    EXPECT_EQ(read(readPropertyList, file).value, Value(true)) << file;
  EXPECT_EQ(read(readPropertyList, " <ab cd>").value, Value(Bytes{0xAB, 0xCD}));
  EXPECT_EQ(read(readPropertyList, "<abcdef>").value, Value(Bytes{0xAB, 0xCD, 0xEF}));
  EXPECT_EQ(read(readPropertyList, "bplist").value, Value("bplist"));
}

}  // namespace
}  // namespace kel::platform
