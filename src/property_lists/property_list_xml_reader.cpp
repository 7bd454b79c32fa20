#include <algorithm>
#include <charconv>
#include <chrono>
#include <cmath>
#include <limits>

#include "property_lists/property_list.h"
#include "property_lists/property_list_parsing.h"
#include "property_lists/xml_scanner.h"

namespace kel::platform {

namespace {

enum class Element { Key, String, Dict, Array, True, False, Integer, Real, Date, Data, Plist };
constexpr std::string_view elementNames[] = {"key",     "string", "dict", "array", "true", "false",
                                             "integer", "real",   "date", "data",  "plist"};

std::string_view nameOf(Element element) { return elementNames[static_cast<std::size_t>(element)]; }

std::string_view withoutBlanks(std::string_view text) {
  while (!text.empty() && isBlank(text.front())) text.remove_prefix(1);
  while (!text.empty() && isBlank(text.back())) text.remove_suffix(1);
  return text;
}

/// Decimal, or hexadecimal after "0x", with or without a sign.
std::optional<PropertyListInteger> parseInteger(std::string_view text) {
  const bool isNegative = text.starts_with('-');
  if (isNegative || text.starts_with('+')) text.remove_prefix(1);
  const bool isHexadecimal = text.starts_with("0x") || text.starts_with("0X");
  if (isHexadecimal) text.remove_prefix(2);
  std::uint64_t magnitude = 0;
  const char* end = text.data() + text.size();
  const auto [stop, error] = std::from_chars(text.data(), end, magnitude, isHexadecimal ? 16 : 10);
  if (error != std::errc() || stop != end) return std::nullopt;
  if (!isNegative || magnitude == 0) return PropertyListInteger{magnitude, false};
  // A negative one has 63 bits and the smallest; a positive one may need all 64.
  if (magnitude > std::uint64_t{1} << 63) return std::nullopt;
  return PropertyListInteger{0 - magnitude, true};
}

std::optional<double> parseReal(std::string_view text) {
  // from_chars takes no "+". The "nan(...)" that it takes is refused below.
  if (text.starts_with('+')) {
    text.remove_prefix(1);
    if (text.starts_with('-')) return std::nullopt;
  }
  double value = 0;
  const char* end = text.data() + text.size();
  const auto [stop, error] = std::from_chars(text.data(), end, value);
  const bool hasPayload = text.ends_with(')');
  if (error != std::errc() || stop != end || hasPayload) return std::nullopt;
  return value;
}

/// YYYY-MM-DDTHH:MM:SSZ
std::optional<PropertyListDate> parseDate(std::string_view text) {
  using namespace std::chrono;
  constexpr std::string_view pattern = "0000-00-00T00:00:00Z";
  const auto fits = [](char c, char p) { return p == '0' ? c >= '0' && c <= '9' : c == p; };
  if (!std::equal(text.begin(), text.end(), pattern.begin(), pattern.end(), fits)) return std::nullopt;
  const auto field = [text](std::size_t position, std::size_t length) {
    int number = 0;
    for (const char digit : text.substr(position, length)) number = 10 * number + (digit - '0');
    return number;
  };
  const year_month_day day(year{field(0, 4)}, month{static_cast<unsigned>(field(5, 2))},
                           std::chrono::day{static_cast<unsigned>(field(8, 2))});
  const int hour = field(11, 2);
  const int minute = field(14, 2);
  const int second = field(17, 2);
  if (!day.ok() || hour > 23 || minute > 59 || second > 59) return std::nullopt;
  const auto time =
      sys_days(day) - sys_days(year{2001} / January / 1) + hours{hour} + minutes{minute} + seconds{second};
  return PropertyListDate{static_cast<double>(seconds(time).count())};
}

int base64Digit(char c) {
  if (c >= 'A' && c <= 'Z') return c - 'A';
  if (c >= 'a' && c <= 'z') return c - 'a' + 26;
  if (c >= '0' && c <= '9') return c - '0' + 52;
  return c == '+' ? 62 : c == '/' ? 63 : -1;
}

std::optional<Bytes> parseBase64(std::string_view text) {
  Bytes bytes;
  bytes.reserve(text.size() / 4 * 3);
  std::uint32_t group = 0;
  int digits = 0;
  int padding = 0;
  bool isAtEnd = false;  // behind a padded group, which is the last one
  for (const char c : text) {
    if (isBlank(c)) continue;
    const int digit = base64Digit(c);
    if (c == '=') ++padding;
    if (isAtEnd || padding > 2 || (digit < 0) != (padding > 0)) return std::nullopt;
    group = group << 6 | static_cast<std::uint32_t>(std::max(digit, 0));
    if (++digits < 4) continue;
    for (int i = 0; i < 3 - padding; ++i) bytes.push_back(static_cast<std::uint8_t>(group >> (16 - 8 * i)));
    isAtEnd = padding > 0;
    digits = 0;
    group = 0;
  }
  if (digits != 0) return std::nullopt;
  return bytes;
}

class XMLReader {
 public:
  XMLReader(std::string_view text, const PropertyListLimits& limits)
      : scanner_(text), assembly_(limits, text.size()) {}

  PropertyListValue read() {
    scanner_.skipProlog();
    Tag tag = readStartTag();
    const bool inPlist = tag.element == Element::Plist;
    if (inPlist) {
      if (tag.isEmpty) scanner_.fail("a value expected");
      scanner_.skipMisc();
      tag = readStartTag();
    }
    beginValue(tag);
    while (!assembly_.isComplete()) readPart();
    scanner_.skipMisc();
    if (inPlist) {
      scanner_.readEndTag(nameOf(Element::Plist));
      scanner_.skipMisc();
    }
    if (!scanner_.atEnd()) scanner_.fail("the end expected");
    return assembly_.result();
  }

 private:
  struct Tag {
    Element element;
    bool isEmpty;
    std::size_t position;
  };

  [[noreturn]] static void failAt(std::size_t position, std::string what) {
    throw MalformedPropertyList{position, std::move(what)};
  }

  Tag readStartTag() {
    const XMLScanner::Tag tag = scanner_.readStartTag();
    const auto* name = std::find(std::begin(elementNames), std::end(elementNames), tag.name);
    if (name == std::end(elementNames)) failAt(tag.position, "unknown element");
    return {static_cast<Element>(name - std::begin(elementNames)), tag.isEmpty, tag.position};
  }

  /// Reads one part of the innermost container, or its end.
  void readPart() {
    scanner_.skipMisc();
    if (scanner_.isAtEndTag()) {
      if (assembly_.awaitsValue()) scanner_.fail("a key without a value");
      scanner_.readEndTag(nameOf(assembly_.inDictionary() ? Element::Dict : Element::Array));
      return assembly_.close();
    }
    const Tag tag = readStartTag();
    if (!assembly_.inDictionary() || assembly_.awaitsValue()) return beginValue(tag);
    if (tag.element != Element::Key) failAt(tag.position, "a key expected");
    assembly_.setKey(strings_.get(readText(tag)), tag.position);
  }

  /// Reads the value that `tag` begins up to its end, or up to the first part of a container.
  void beginValue(const Tag& tag) {
    switch (tag.element) {
      case Element::Dict:
        assembly_.openDictionary(tag.position);
        if (tag.isEmpty) assembly_.close();
        return;
      case Element::Array:
        assembly_.openArray(tag.position);
        if (tag.isEmpty) assembly_.close();
        return;
      case Element::Key:
      case Element::Plist:
        failAt(tag.position, "a value expected");
      default:
        assembly_.add(readLeaf(tag), tag.position);
    }
  }

  PropertyListValue readLeaf(const Tag& tag) {
    const std::string_view text = readText(tag);
    switch (tag.element) {
      case Element::String:
        return strings_.get(text);
      case Element::True:
      case Element::False:
        if (!withoutBlanks(text).empty()) failAt(tag.position, "a boolean with contents");
        return tag.element == Element::True;
      case Element::Integer:
        return parsed(parseInteger(withoutBlanks(text)), tag, "no integer of 64 bits");
      case Element::Real:
        return parsed(parseReal(withoutBlanks(text)), tag, "no real of 64 bits");
      case Element::Date:
        return parsed(parseDate(withoutBlanks(text)), tag, "no date of the form YYYY-MM-DDTHH:MM:SSZ");
      default:
        return parsed(parseBase64(text), tag, "no base64");
    }
  }

  template <typename Value>
  static PropertyListValue parsed(std::optional<Value> value, const Tag& tag, const char* otherwise) {
    if (!value) failAt(tag.position, otherwise);
    return std::move(*value);
  }

  /// The characters of an element that holds no other, its end tag included; valid until the next call.
  std::string_view readText(const Tag& tag) {
    if (tag.isEmpty) return "";
    const std::string_view text = scanner_.readText();
    scanner_.readEndTag(nameOf(tag.element));
    return text;
  }

  XMLScanner scanner_;
  PropertyListAssembly assembly_;
  SharedStrings strings_;
};

}  // namespace

PropertyListReading readXMLText(std::string_view text, const PropertyListLimits& limits) {
  try {
    return {XMLReader(text, limits).read(), {}};
  } catch (const MalformedPropertyList& malformed) {
    return malformedAt(text, malformed);
  }
}

}  // namespace kel::platform
