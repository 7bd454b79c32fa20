#include "property_lists/unicode.h"

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <iterator>

namespace kel::platform {

namespace {

constexpr char32_t replacement = 0xFFFD;

/// The lower-case forms of the characters `first`, `first + step`, ... `last`: each plus `distance`.
struct LowerCaseRange {
  char32_t first;
  char32_t last;
  std::uint32_t step;
  std::int32_t distance;
};

constexpr LowerCaseRange lowerCaseRanges[] = {
#include "property_lists/unicode_lower_case_table.inc"
};

bool isSurrogate(char32_t character) { return character >= 0xD800 && character <= 0xDFFF; }

/// The length of the well-formed sequence at the front of `text`, its character in `character`; 0 when there
/// is none. `text` is not empty.
std::size_t decode(std::string_view text, char32_t& character) {
  const auto lead = static_cast<unsigned char>(text[0]);
  character = lead;
  if (lead < 0x80) return 1;
  if (lead < 0xC2 || lead > 0xF4) return 0;
  const std::size_t length = lead < 0xE0 ? 2 : lead < 0xF0 ? 3 : 4;
  if (text.size() < length) return 0;
  character = lead & (0x7FU >> length);
  for (std::size_t i = 1; i < length; ++i) {
    const auto next = static_cast<unsigned char>(text[i]);
    if ((next & 0xC0) != 0x80) return 0;
    character = character << 6 | (next & 0x3FU);
  }
  // Two ways to write one character would make two keys of one name.
  const bool overlong = (length == 3 && character < 0x800) || (length == 4 && character < 0x10000);
  return overlong || isSurrogate(character) || character > 0x10FFFF ? 0 : length;
}

std::size_t asciiPrefix(std::string_view text) {
  // Nearly all text is ASCII: eight bytes at a time, through a copy, because a text lies at any address.
  std::size_t position = 0;
  for (std::uint64_t block; position + sizeof block <= text.size(); position += sizeof block) {
    std::memcpy(&block, text.data() + position, sizeof block);
    if ((block & 0x8080808080808080U) != 0) break;
  }
  while (position < text.size() && static_cast<unsigned char>(text[position]) < 0x80) ++position;
  return position;
}

char32_t lowerCaseOf(char32_t character) {
  const auto* range = std::lower_bound(std::begin(lowerCaseRanges), std::end(lowerCaseRanges), character,
                                       [](const LowerCaseRange& r, char32_t c) { return r.last < c; });
  if (range == std::end(lowerCaseRanges) || character < range->first) return character;
  if ((character - range->first) % range->step != 0) return character;
  return static_cast<char32_t>(static_cast<std::int32_t>(character) + range->distance);
}

}  // namespace

bool isValidUTF8(std::string_view text) {
  char32_t character = 0;
  for (;;) {
    text.remove_prefix(asciiPrefix(text));
    if (text.empty()) return true;
    // One by one until ASCII begins again: blocks are no use in other scripts.
    do {
      const std::size_t length = decode(text, character);
      if (length == 0) return false;
      text.remove_prefix(length);
    } while (!text.empty() && static_cast<unsigned char>(text[0]) >= 0x80);
  }
}

void appendUTF8(std::string& text, char32_t character) {
  if (character > 0x10FFFF || isSurrogate(character)) character = replacement;
  const auto append = [&text](char32_t byte) { text += static_cast<char>(static_cast<unsigned char>(byte)); };
  if (character < 0x80) return append(character);
  if (character < 0x800) {
    append(0xC0 | character >> 6);
  } else {
    if (character < 0x10000) {
      append(0xE0 | character >> 12);
    } else {
      append(0xF0 | character >> 18);
      append(0x80 | (character >> 12 & 0x3F));
    }
    append(0x80 | (character >> 6 & 0x3F));
  }
  append(0x80 | (character & 0x3F));
}

char32_t nextCharacter(std::string_view text, std::size_t& position) {
  char32_t character = 0;
  const std::size_t length = decode(text.substr(position), character);
  position += std::max<std::size_t>(length, 1);
  return length == 0 ? replacement : character;
}

std::size_t utf16Length(std::string_view text) {
  std::size_t length = 0;
  for (std::size_t position = 0; position < text.size();) {
    length += nextCharacter(text, position) >= 0x10000 ? 2 : 1;
  }
  return length;
}

Bytes utf16LittleEndianWithMark(std::string_view text) {
  Bytes bytes;
  bytes.reserve(2 + 2 * text.size());
  const auto append = [&bytes](char32_t unit) {
    bytes.push_back(static_cast<std::uint8_t>(unit & 0xFF));
    bytes.push_back(static_cast<std::uint8_t>(unit >> 8));
  };
  append(0xFEFF);
  for (std::size_t position = 0; position < text.size();) {
    const char32_t character = nextCharacter(text, position);
    if (character < 0x10000) {
      append(character);
    } else {
      append(0xD800 + ((character - 0x10000) >> 10));
      append(0xDC00 + ((character - 0x10000) & 0x3FF));
    }
  }
  return bytes;
}

std::optional<std::string> utf8FromUTF16(BytesView units, bool bigEndian) {
  if (units.size() % 2 != 0) return std::nullopt;
  const auto unitAt = [&](std::size_t i) -> char32_t {
    return bigEndian ? static_cast<char32_t>(units[i] << 8 | units[i + 1])
                     : static_cast<char32_t>(units[i + 1] << 8 | units[i]);
  };
  std::string text;
  text.reserve(units.size() / 2);
  for (std::size_t i = 0; i < units.size(); i += 2) {
    char32_t character = unitAt(i);
    if (isSurrogate(character)) {
      if (character >= 0xDC00 || i + 2 == units.size()) return std::nullopt;
      i += 2;
      const char32_t low = unitAt(i);
      if (low < 0xDC00 || low > 0xDFFF) return std::nullopt;
      character = 0x10000 + ((character - 0xD800) << 10) + (low - 0xDC00);
    }
    appendUTF8(text, character);
  }
  return text;
}

std::string lowerCase(std::string_view text) {
  constexpr char32_t capitalIWithDotAbove = 0x130;
  std::string lower;
  lower.reserve(text.size());
  for (std::size_t position = 0; position < text.size();) {
    const std::size_t start = position;
    const char32_t character = nextCharacter(text, position);
    if (character == capitalIWithDotAbove) {
      // The only character whose lower-case form is two.
      lower += "i\u0307";
      continue;
    }
    const char32_t mapped = lowerCaseOf(character);
    // What has no lower-case form, ill-formed bytes included, stays as it is written.
    if (mapped == character) {
      lower += text.substr(start, position - start);
    } else {
      appendUTF8(lower, mapped);
    }
  }
  return lower;
}

}  // namespace kel::platform
