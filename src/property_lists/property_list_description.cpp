// How values are printed.
//
// The form is the text encoding, so that what `-dump` prints can be read back. That encoding knows strings,
// data and containers only: numbers, booleans and dates come out as bare or quoted strings, and reading gives
// strings. Keys stand in their ascending order, every part on its own line, four blanks deeper than the
// container it is in.
//
// The walk keeps the containers it is in on a stack of its own and asks after every part whether enough was
// printed. Indentation makes that necessary: a value of 512 levels has lines of 2,000 blanks, and a log line
// about a hostile message must not be hundreds of times as long as the message.
//
// Never happens: a control character in the output, whoever declared it, because it goes to a terminal or
// into a log; a cut within a character; two ways to print one value.

#include <algorithm>
#include <charconv>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <limits>

#include "property_lists/property_list.h"
#include "property_lists/property_list_parsing.h"
#include "property_lists/unicode.h"

namespace kel::platform {

namespace {

bool isBareString(std::string_view text) {
  return !text.empty() && std::all_of(text.begin(), text.end(), isBare) &&
         text.find("//") == std::string_view::npos;
}

std::string realText(double value) {
  char digits[32];
  const auto end = std::to_chars(std::begin(digits), std::end(digits), value).ptr;
  return {digits, end};
}

/// ISO 8601, or the number of seconds for what four digits of a year cannot express.
std::string dateText(PropertyListDate date) {
  using namespace std::chrono;
  constexpr sys_days epoch = year{2001} / January / 1;
  constexpr auto first = static_cast<double>((sys_days(year{0} / January / 1) - epoch) / seconds{1});
  constexpr auto end = static_cast<double>((sys_days(year{10000} / January / 1) - epoch) / seconds{1});
  if (!(date.secondsSince2001 >= first && date.secondsSince2001 < end)) {
    return realText(date.secondsSince2001);
  }
  const auto time = epoch + seconds{static_cast<std::int64_t>(std::floor(date.secondsSince2001))};
  const auto days = floor<std::chrono::days>(time);
  const year_month_day day(days);
  const hh_mm_ss clock(time - days);
  char text[64];
  std::snprintf(text, sizeof text, "%04d-%02u-%02uT%02d:%02d:%02dZ", static_cast<int>(day.year()),
                static_cast<unsigned>(day.month()), static_cast<unsigned>(day.day()),
                static_cast<int>(clock.hours().count()), static_cast<int>(clock.minutes().count()),
                static_cast<int>(clock.seconds().count()));
  return text;
}

class Describer {
 public:
  /// Stops soon after `longest` bytes.
  std::string describe(const PropertyListValue& top, std::size_t longest) {
    begin(top);
    while (!open_.empty() && text_.size() <= longest) {
      Container& container = open_.back();
      if (container.next == container.size()) {
        const char closing = container.dictionary ? '}' : ')';
        open_.pop_back();
        indent();
        text_ += closing;
        end();
        continue;
      }
      indent();
      const std::size_t index = container.next++;
      if (container.array) {
        begin((*container.array)[index]);
      } else {
        const auto& [key, value] = container.dictionary->begin()[static_cast<std::ptrdiff_t>(index)];
        appendString(key.text());
        text_ += " = ";
        begin(value);
      }
    }
    return std::move(text_);
  }

 private:
  struct Container {
    const PropertyListArray* array;
    const PropertyListDictionary* dictionary;
    std::size_t next = 0;

    std::size_t size() const { return array ? array->size() : dictionary->size(); }
  };

  void begin(const PropertyListValue& value) {
    if (value.asArray() || value.asDictionary()) {
      text_ += value.asArray() ? "(\n" : "{\n";
      open_.push_back({value.asArray(), value.asDictionary()});
    } else {
      appendLeaf(value);
      end();
    }
  }

  /// What follows a value: it depends on the container it stands in.
  void end() {
    if (open_.empty()) return;
    const Container& container = open_.back();
    if (container.dictionary) text_ += ';';
    if (container.array && container.next < container.size()) text_ += ',';
    text_ += '\n';
  }

  void indent() { text_.append(4 * open_.size(), ' '); }

  void appendLeaf(const PropertyListValue& value) {
    if (const auto boolean = value.asBoolean()) {
      text_ += *boolean ? '1' : '0';
    } else if (const auto integer = value.asInteger()) {
      text_ += integer->isNegative ? std::to_string(static_cast<std::int64_t>(integer->bits))
                                   : std::to_string(integer->bits);
    } else if (const auto real = value.asReal()) {
      appendString(realText(*real));
    } else if (const auto date = value.asDate()) {
      appendString(dateText(*date));
    } else if (const SharedBytes* data = value.asData()) {
      appendData(**data);
    } else {
      appendString(*value.asString());
    }
  }

  void appendData(const Bytes& data) {
    constexpr const char* digits = "0123456789abcdef";
    text_ += '<';
    for (std::size_t i = 0; i < data.size(); ++i) {
      if (i > 0 && i % 4 == 0) text_ += ' ';
      text_ += digits[data[i] >> 4];
      text_ += digits[data[i] & 0xF];
    }
    text_ += '>';
  }

  void appendString(std::string_view text) {
    if (isBareString(text)) {
      text_ += text;
      return;
    }
    text_ += '"';
    for (std::size_t position = 0; position < text.size();) appendQuoted(nextCharacter(text, position));
    text_ += '"';
  }

  /// Control characters are escaped, so that what is printed cannot drive a terminal.
  void appendQuoted(char32_t character) {
    constexpr std::string_view escaped = "\"\\\n\t\r\a\b\f\v";
    constexpr std::string_view letters = "\"\\ntrabfv";
    const bool isControl = character < 0x20 || (character >= 0x7F && character < 0xA0);
    const std::size_t escape =
        character < 0x80 ? escaped.find(static_cast<char>(character)) : std::string_view::npos;
    if (escape != std::string_view::npos) {
      text_ += '\\';
      text_ += letters[escape];
    } else if (isControl) {
      char octal[8];
      std::snprintf(octal, sizeof octal, "\\%03o", static_cast<unsigned>(character & 0xFF));
      text_ += octal;
    } else {
      appendUTF8(text_, character);
    }
  }

  std::vector<Container> open_;
  std::string text_;
};

}  // namespace

std::string describe(const PropertyListValue& value) {
  return Describer().describe(value, std::numeric_limits<std::size_t>::max());
}

std::string describeBriefly(const PropertyListValue& value, std::size_t longest) {
  std::string text = Describer().describe(value, longest);
  if (text.size() <= longest) return text;
  // Not within a character: its further bytes begin with the bits 10.
  while (longest > 0 && (static_cast<unsigned char>(text[longest]) & 0xC0) == 0x80) --longest;
  text.resize(longest);
  return text + " [cut]";
}

}  // namespace kel::platform
