// What of XML is understood.
//
// A property list needs tags and text. The scanner gives them to the reader in one pass over the decoded
// text, without a tree, and skips what says nothing about the value: the declaration, the document type,
// comments, processing instructions, attributes. Except for the document type, what is skipped must be
// well-formed all the same: a file that other programs refuse shall not work here by luck.
//
// A text is handed out as a view of the input for as long as it stands there as it is. Only a reference, a
// carriage return, a comment or a CDATA section in it makes a copy, in `gathered_`.
//
// Never happens: anything is fetched, for neither the document type nor an entity is looked up anywhere; an
// entity grows, for what a document type declares is skipped unread, the five predefined ones are all there
// are, and none stands for more bytes than it is written with.

#include "property_lists/xml_scanner.h"

#include <algorithm>
#include <array>

#include "property_lists/property_list_parsing.h"
#include "property_lists/unicode.h"

namespace kel::platform {

namespace {

bool isXMLCharacter(char32_t c) {
  return c == '\t' || c == '\n' || c == '\r' || (c >= 0x20 && c <= 0xD7FF) || (c >= 0xE000 && c <= 0xFFFD) ||
         (c >= 0x10000 && c <= 0x10FFFF);
}

bool isXMLBlank(char c) { return c == ' ' || c == '\n' || c == '\t' || c == '\r'; }

bool isNameStart(char c) {
  return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || c == '_' || c == ':' || (c & 0x80) != 0;
}

bool isNameCharacter(char c) { return isNameStart(c) || (c >= '0' && c <= '9') || c == '-' || c == '.'; }

std::string upperCaseASCII(std::string_view text) {
  std::string upper(text);
  for (char& c : upper) {
    if (c >= 'a' && c <= 'z') c = static_cast<char>(c - 'a' + 'A');
  }
  return upper;
}

/// True for characters that text cannot simply be copied over.
constexpr std::array<bool, 256> endsPlainText = [] {
  std::array<bool, 256> ends{};
  for (const char c : {'<', '&', '\r', ']'}) ends[static_cast<unsigned char>(c)] = true;
  return ends;
}();

}  // namespace

void XMLScanner::failAt(std::size_t position, const char* what) {
  throw MalformedPropertyList{position, what};
}

bool XMLScanner::skip(std::string_view word) {
  if (!isNext(word)) return false;
  position_ += word.size();
  return true;
}

void XMLScanner::expect(char c, const char* otherwise) {
  if (!isNext(c)) fail(otherwise);
  ++position_;
}

bool XMLScanner::skipBlanks() {
  const std::size_t start = position_;
  while (!atEnd() && isXMLBlank(text_[position_])) ++position_;
  return position_ > start;
}

/// Moves behind the next `end`; the characters before it.
std::string_view XMLScanner::readThrough(std::string_view end, const char* unterminated) {
  const std::size_t found = text_.find(end, position_);
  if (found == std::string_view::npos) fail(unterminated);
  const std::string_view before = text_.substr(position_, found - position_);
  position_ = found + end.size();
  return before;
}

void XMLScanner::checkCharacters() const {
  for (std::size_t position = 0; position < text_.size(); ++position) {
    const auto byte = static_cast<unsigned char>(text_[position]);
    const bool isControl = byte < 0x20 && !isXMLBlank(text_[position]);
    // U+FFFE and U+FFFF; surrogates cannot occur in well-formed UTF-8.
    const bool isNoncharacter = byte == 0xEF && text_.substr(position + 1, 2) >= "\xBF\xBE";
    if (isControl || isNoncharacter) failAt(position, "a character that XML does not allow");
  }
}

void XMLScanner::skipProlog() {
  checkCharacters();
  if (isNext("<?xml") && position_ + 5 < text_.size() && !isNameCharacter(text_[position_ + 5])) {
    skipDeclaration();
  }
  skipMisc();
  if (skip("<!DOCTYPE")) {
    skipDocumentType();
    skipMisc();
  }
}

void XMLScanner::skipMisc() {
  for (;;) {
    skipBlanks();
    if (isNext("<!--")) {
      skipComment();
    } else if (isNext("<?")) {
      skipProcessingInstruction();
    } else {
      return;
    }
  }
}

void XMLScanner::skipDeclaration() {
  position_ += 5;
  for (bool first = true;; first = false) {
    const bool separated = skipBlanks();
    if (!first && skip("?>")) return;
    const std::size_t start = position_;
    const std::string_view name = readName();
    const std::string_view value = readAttributeValue();
    const bool known = first ? name == "version" : name == "encoding" || name == "standalone";
    if (!separated || !known) failAt(start, "malformed XML declaration");
    if (first && !value.starts_with("1.")) failAt(start, "unknown XML version");
    if (name != "encoding") continue;
    const std::string encoding = upperCaseASCII(value);
    if (encoding != "UTF-8" && encoding != "UTF-16" && encoding != "US-ASCII") {
      failAt(start, "unsupported encoding");
    }
  }
}

void XMLScanner::skipDocumentType() {
  const std::size_t start = position_;
  // A ">" ends it only outside of the internal subset, of literals and of comments.
  bool inSubset = false;
  while (!atEnd()) {
    if (isNext("<!--")) {
      skipComment();
    } else if (isNext("<?")) {
      skipProcessingInstruction();
    } else {
      const char c = text_[position_++];
      if (c == '"' || c == '\'') readThrough({&c, 1}, "unterminated literal");
      if (c == '[') inSubset = true;
      if (c == ']') inSubset = false;
      if (c == '>' && !inSubset) return;
    }
  }
  failAt(start, "unterminated document type");
}

void XMLScanner::skipComment() {
  const std::size_t start = position_;
  position_ += 4;
  readThrough("--", "unterminated comment");
  if (!skip(">")) failAt(start, "a comment with \"--\" inside or without an end");
}

void XMLScanner::skipProcessingInstruction() {
  const std::size_t start = position_;
  position_ += 2;
  const std::string_view target = readName();
  if (upperCaseASCII(target) == "XML") failAt(start, "an XML declaration that is not at the beginning");
  if (!isNext("?>") && !skipBlanks()) fail("malformed processing instruction");
  readThrough("?>", "unterminated processing instruction");
}

std::string_view XMLScanner::readName() {
  const std::size_t start = position_;
  if (atEnd()) fail("unexpected end");
  if (!isNameStart(text_[position_])) fail("a name expected");
  while (!atEnd() && isNameCharacter(text_[position_])) ++position_;
  return text_.substr(start, position_ - start);
}

XMLScanner::Tag XMLScanner::readStartTag() {
  const std::size_t start = position_;
  if (atEnd()) fail("unexpected end");
  if (isAtEndTag()) fail("a value expected");
  expect('<', "text outside of an element");
  const std::string_view name = readName();
  if (!isNext('>')) skipAttributes();
  const bool isEmpty = skip("/");
  expect('>', "malformed tag");
  return {name, isEmpty, start};
}

/// Attributes say nothing about the value, but must be well-formed.
void XMLScanner::skipAttributes() {
  while (skipBlanks() && !isNext('>') && !isNext('/')) {
    readName();
    readAttributeValue();
  }
}

/// "= value" in quotes; the value as it is written.
std::string_view XMLScanner::readAttributeValue() {
  skipBlanks();
  expect('=', "'=' expected");
  skipBlanks();
  if (!isNext('"') && !isNext('\'')) fail("a quoted value expected");
  const char quote = text_[position_++];
  const std::size_t start = position_;
  std::string ignored;
  while (!atEnd() && text_[position_] != quote) {
    if (text_[position_] == '<') fail("\"<\" in an attribute");
    if (text_[position_] == '&') {
      appendReference(ignored);
    } else {
      ++position_;
    }
  }
  expect(quote, "unterminated attribute");
  return text_.substr(start, position_ - 1 - start);
}

void XMLScanner::readEndTag(std::string_view name) {
  const std::size_t start = position_;
  const bool fits = skip("</") && skip(name);
  if (fits) skipBlanks();
  if (!fits || !skip(">")) failAt(start, atEnd() ? "unexpected end" : "another end tag expected");
}

std::string_view XMLScanner::readText() {
  gathered_.clear();
  for (;;) {
    const std::size_t start = position_;
    while (!atEnd() && !endsPlainText[static_cast<unsigned char>(text_[position_])]) ++position_;
    const std::string_view plain = text_.substr(start, position_ - start);
    if (isAtEndTag()) return gathered_.empty() ? plain : std::string_view(gathered_.append(plain));
    gathered_ += plain;
    appendMarkup();
  }
}

/// Appends what the character that ended plain text stands for.
void XMLScanner::appendMarkup() {
  if (atEnd()) fail("unexpected end");
  if (isNext('&')) return appendReference(gathered_);
  if (skip("\r\n") || skip("\r")) {
    gathered_ += '\n';
  } else if (isNext(']')) {
    if (isNext("]]>")) fail("\"]]>\" outside of a CDATA section");
    gathered_ += ']';
    ++position_;
  } else if (isNext("<!--")) {
    skipComment();
  } else if (isNext("<?")) {
    skipProcessingInstruction();
  } else if (skip("<![CDATA[")) {
    const std::string_view literal = readThrough("]]>", "unterminated CDATA section");
    for (std::size_t i = 0; i < literal.size(); ++i) {
      if (literal[i] != '\r') {
        gathered_ += literal[i];
      } else if (!literal.substr(i + 1).starts_with('\n')) {
        gathered_ += '\n';
      }
    }
  } else {
    fail("an element where text is expected");
  }
}

void XMLScanner::appendReference(std::string& text) {
  const std::size_t start = position_;
  if (skip("&#")) return appendUTF8(text, readCharacterReference());
  ++position_;
  const std::string_view name = readName();
  if (!skip(";")) failAt(start, "unterminated reference");
  if (name == "amp") {
    text += '&';
  } else if (name == "lt") {
    text += '<';
  } else if (name == "gt") {
    text += '>';
  } else if (name == "quot") {
    text += '"';
  } else if (name == "apos") {
    text += '\'';
  } else {
    failAt(start, "unknown entity");
  }
}

/// Reads what follows "&#".
char32_t XMLScanner::readCharacterReference() {
  const std::size_t start = position_ - 2;
  const int base = skip("x") ? 16 : 10;
  const std::size_t firstDigit = position_;
  char32_t character = 0;
  for (; !atEnd(); ++position_) {
    const int digit = hexadecimalDigit(text_[position_]);
    if (digit < 0 || digit >= base) break;
    character = character * static_cast<char32_t>(base) + static_cast<char32_t>(digit);
    character = std::min<char32_t>(character, 0x110000);  // never overflows, always refused
  }
  if (position_ == firstDigit || !skip(";")) failAt(start, "malformed character reference");
  if (!isXMLCharacter(character)) failAt(start, "a character that XML does not allow");
  return character;
}

}  // namespace kel::platform
