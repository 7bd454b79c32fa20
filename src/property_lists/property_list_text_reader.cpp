#include "property_lists/property_list.h"
#include "property_lists/property_list_parsing.h"
#include "property_lists/unicode.h"

namespace kel::platform {

namespace {

class TextReader {
 public:
  TextReader(std::string_view text, const PropertyListLimits& limits)
      : text_(text), assembly_(limits, text.size()) {}

  PropertyListValue read() {
    beginDocument();
    while (!assembly_.isComplete()) {
      skipBlanks();
      if (assembly_.inDictionary()) {
        readPair();
      } else {
        readElement();
      }
    }
    skipBlanks();
    if (!atEnd()) fail("the end expected");
    return assembly_.result();
  }

 private:
  [[noreturn]] void fail(std::string what) const { failAt(position_, std::move(what)); }
  [[noreturn]] static void failAt(std::size_t position, std::string what) {
    throw MalformedPropertyList{position, std::move(what)};
  }

  bool atEnd() const { return position_ == text_.size(); }
  bool isNext(char c) const { return !atEnd() && text_[position_] == c; }
  bool isNext(std::string_view word) const { return text_.substr(position_).starts_with(word); }

  bool beginsComment() const { return isNext("//") || isNext("/*"); }

  bool skip(char c) {
    if (!isNext(c)) return false;
    ++position_;
    return true;
  }

  void skipBlanks() {
    for (;;) {
      while (!atEnd() && isBlank(text_[position_])) ++position_;
      if (!isNext('/') || !beginsComment()) return;
      if (isNext("//")) {
        position_ = std::min(text_.find_first_of("\r\n", position_), text_.size());
      } else {
        const std::size_t end = text_.find("*/", position_ + 2);
        if (end == std::string_view::npos) fail("unterminated comment");
        position_ = end + 2;
      }
    }
  }

  /// A file that begins with a string is that string alone, or pairs without the braces around them.
  void beginDocument() {
    skipBlanks();
    const bool holdsString = !atEnd() && !isNext('{') && !isNext('(') && !isNext('<');
    const std::size_t start = position_;
    // Which of the two it is shows only behind the string, so that it may be read twice.
    if (holdsString) {
      PropertyListString string = readString();
      skipBlanks();
      if (atEnd()) return assembly_.add(std::move(string), start);
      if (!isNext('=') && !isNext(';')) fail("'=' or ';' expected");
      position_ = start;
    }
    if (holdsString || atEnd()) {
      isStringsFile_ = true;
      assembly_.openDictionary(start);
    } else {
      readValue();
    }
  }

  bool skipDictionaryEnd() {
    if (isStringsFile_ && assembly_.depth() == 1) return atEnd();
    return skip('}');
  }

  void readPair() {
    if (skipDictionaryEnd()) {
      assembly_.close();
      return endValue();
    }
    const std::size_t start = position_;
    PropertyListString key = readString();
    assembly_.setKey(key, start);
    skipBlanks();
    // A key alone stands for itself, as strings files have it for what needs no translation.
    if (isNext(';')) {
      assembly_.add(std::move(key), start);
      return endValue();
    }
    if (!skip('=')) fail("'=' or ';' expected");
    skipBlanks();
    readValue();
  }

  void readElement() {
    if (!skip(')')) return readValue();
    assembly_.close();
    endValue();
  }

  /// Reads a value up to its end, or up to the first part of a container.
  void readValue() {
    const std::size_t start = position_;
    if (skip('{')) return assembly_.openDictionary(start);
    if (skip('(')) return assembly_.openArray(start);
    if (skip('<')) {
      assembly_.add(readData(), start);
    } else {
      assembly_.add(readString(), start);
    }
    endValue();
  }

  /// What must follow a value in the container it stands in.
  void endValue() {
    if (assembly_.isComplete()) return;
    skipBlanks();
    if (assembly_.inDictionary()) {
      if (!skip(';')) fail("';' expected");
    } else if (!skip(',') && !isNext(')')) {
      fail("',' or ')' expected");
    }
  }

  Bytes readData() {
    Bytes data;
    int high = -1;
    for (; !isNext('>'); ++position_) {
      if (atEnd()) fail("unterminated data");
      if (isBlank(text_[position_])) continue;
      const int digit = hexadecimalDigit(text_[position_]);
      if (digit < 0) fail("hexadecimal digit expected");
      if (high < 0) {
        high = digit;
      } else {
        data.push_back(static_cast<std::uint8_t>(high << 4 | digit));
        high = -1;
      }
    }
    if (high >= 0) fail("odd number of hexadecimal digits");
    ++position_;
    return data;
  }

  PropertyListString readString() {
    if (isNext('"') || isNext('\'')) return readQuoted();
    const std::size_t start = position_;
    // A path is a bare string, but "//" and "/*" within one begin a comment.
    while (!atEnd() && isBare(text_[position_]) && !(isNext('/') && beginsComment())) ++position_;
    if (position_ == start) fail(atEnd() ? "unexpected end" : "unexpected character");
    return strings_.get(text_.substr(start, position_ - start));
  }

  PropertyListString readQuoted() {
    const std::size_t start = position_;
    const char quote = text_[position_++];
    std::string unescaped;
    for (;;) {
      std::size_t stop = position_;
      while (stop < text_.size() && text_[stop] != quote && text_[stop] != '\\') ++stop;
      if (stop == text_.size()) failAt(start, "unterminated string");
      const std::string_view plain = text_.substr(position_, stop - position_);
      position_ = stop + 1;
      if (text_[stop] == quote) return strings_.get(unescaped.empty() ? plain : unescaped.append(plain));
      unescaped += plain;
      appendEscaped(unescaped);
    }
  }

  /// Reads what follows a backslash.
  void appendEscaped(std::string& string) {
    constexpr std::string_view letters = "ntrabfv\"'\\\n";
    constexpr std::string_view meanings = "\n\t\r\a\b\f\v\"'\\\n";
    if (atEnd()) fail("unexpected end");
    const char c = text_[position_];
    if (const std::size_t letter = letters.find(c); letter != std::string_view::npos) {
      ++position_;
      string += meanings[letter];
    } else if (c == 'U') {
      appendUTF8(string, readUnicodeEscape());
    } else if (c >= '0' && c <= '7') {
      appendUTF8(string, readOctal());
    } else {
      failAt(position_ - 1, "unknown escape");
    }
  }

  char32_t readOctal() {
    const std::size_t start = position_ - 1;
    char32_t character = 0;
    for (int i = 0; i < 3 && !atEnd() && text_[position_] >= '0' && text_[position_] <= '7'; ++i) {
      character = character * 8 + static_cast<char32_t>(text_[position_++] - '0');
    }
    if (character > 0xFF) failAt(start, "octal escape out of range");
    return character;
  }

  /// "Uxxxx", or two with a backslash between them for a surrogate pair.
  char32_t readUnicodeEscape() {
    const std::size_t start = position_ - 1;
    const char32_t unit = readUnit();
    if (unit < 0xD800 || unit > 0xDFFF) return unit;
    if (unit >= 0xDC00 || !isNext("\\U")) failAt(start, "lone surrogate");
    ++position_;
    const char32_t low = readUnit();
    if (low < 0xDC00 || low > 0xDFFF) failAt(start, "lone surrogate");
    return 0x10000 + ((unit - 0xD800) << 10) + (low - 0xDC00);
  }

  char32_t readUnit() {
    ++position_;
    char32_t unit = 0;
    for (int i = 0; i < 4; ++i) {
      const int digit = atEnd() ? -1 : hexadecimalDigit(text_[position_]);
      if (digit < 0) fail("hexadecimal digit expected");
      unit = unit << 4 | static_cast<char32_t>(digit);
      ++position_;
    }
    return unit;
  }

  const std::string_view text_;
  std::size_t position_ = 0;
  bool isStringsFile_ = false;
  PropertyListAssembly assembly_;
  SharedStrings strings_;
};

}  // namespace

PropertyListReading readPlainText(std::string_view text, const PropertyListLimits& limits) {
  try {
    return {TextReader(text, limits).read(), {}};
  } catch (const MalformedPropertyList& malformed) {
    return malformedAt(text, malformed);
  }
}

}  // namespace kel::platform
