#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

#include "property_lists/bytes.h"

namespace kel::platform {

/// True when `text` is well-formed UTF-8 (no overlong forms, no surrogates, nothing above U+10FFFF).
bool isValidUTF8(std::string_view text);

/// Appends the UTF-8 form of a scalar value; anything else becomes U+FFFD.
void appendUTF8(std::string& text, char32_t character);

/// Decodes the character at `position` of `text` and moves `position` behind it; ill-formed bytes give
/// U+FFFD, one byte at a time. `position` is less than the size of `text`.
char32_t nextCharacter(std::string_view text, std::size_t& position);

/// The length of `text` in UTF-16 code units.
std::size_t utf16Length(std::string_view text);

/// A byte-order mark and the UTF-16 code units of `text`, little-endian.
Bytes utf16LittleEndianWithMark(std::string_view text);

/// UTF-8 of UTF-16 code units, or absent when a surrogate stands alone or a byte is left over. No mark is
/// looked for.
std::optional<std::string> utf8FromUTF16(BytesView units, bool bigEndian);

/// `text` in lower case by the Unicode character database's full mapping, independent of any locale (the
/// context of a final sigma is not looked at).
std::string lowerCase(std::string_view text);

}  // namespace kel::platform
