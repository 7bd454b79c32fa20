#pragma once

#include <cstddef>
#include <string>
#include <string_view>

namespace kel::platform {

/// Splits an XML document into tags and text for the property-list reader, in one pass and without a tree.
/// A document type is skipped, never fetched: no entity is known but the five predefined ones. The operations
/// throw `MalformedPropertyList` for what is not well-formed. Borrows the text.
class XMLScanner {
 public:
  struct Tag {
    std::string_view name;
    bool isEmpty;          // "<name/>"
    std::size_t position;  // of its "<"
  };

  /// `text` is well-formed UTF-8 without a mark.
  explicit XMLScanner(std::string_view text) : text_(text) {}

  /// Skips what stands before the root element.
  void skipProlog();

  /// Skips blanks, comments and processing instructions.
  void skipMisc();

  Tag readStartTag();
  bool isAtEndTag() const { return isNext("</"); }
  void readEndTag(std::string_view name);

  /// The characters up to the next tag, with references replaced, line ends made uniform, and comments left
  /// out. Valid until the next call.
  std::string_view readText();

  bool atEnd() const { return position_ == text_.size(); }
  [[noreturn]] void fail(const char* what) const { failAt(position_, what); }

 private:
  [[noreturn]] static void failAt(std::size_t position, const char* what);

  bool isNext(char c) const { return !atEnd() && text_[position_] == c; }
  bool isNext(std::string_view word) const { return text_.substr(position_).starts_with(word); }
  bool skip(std::string_view word);
  void expect(char c, const char* otherwise);
  bool skipBlanks();
  std::string_view readThrough(std::string_view end, const char* unterminated);

  void checkCharacters() const;
  void skipDeclaration();
  void skipDocumentType();
  void skipComment();
  void skipProcessingInstruction();
  std::string_view readName();
  std::string_view readAttributeValue();
  void skipAttributes();
  void appendMarkup();
  void appendReference(std::string& text);
  char32_t readCharacterReference();

  std::string_view text_;
  std::size_t position_ = 0;
  std::string gathered_;
};

}  // namespace kel::platform
