#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "property_lists/bytes.h"
#include "property_lists/property_list_value.h"

namespace kel::platform {

/// What a reader accepts. Foreign bytes can nest deeply and, in the binary encoding, share parts so that the
/// value is far larger than the file.
struct PropertyListLimits {
  std::uint32_t depth = 512;
  /// Largest `expandedSize`; absent: 64 MiB plus 16 times the input's size.
  std::optional<std::uint64_t> expandedSize;
};

/// What the writer writes, and so the limits for what this program wrote itself.
inline constexpr PropertyListLimits ownLimits{512, std::uint64_t{1} << 30};

/// A value, or one line that says what is wrong and where.
struct PropertyListReading {
  std::optional<PropertyListValue> value;
  std::string error;
};

/// Reads any encoding: binary when the bytes begin with "bplist00", XML when the first character that is no
/// blank is "<" and begins a tag, declaration or comment, else text (the strings-file form included). Any
/// thread; linear in the size of `bytes`.
PropertyListReading readPropertyList(BytesView bytes, const PropertyListLimits& limits = {});

PropertyListReading readBinaryPropertyList(BytesView bytes, const PropertyListLimits& limits = {});
PropertyListReading readXMLPropertyList(BytesView bytes, const PropertyListLimits& limits = {});
PropertyListReading readTextPropertyList(BytesView bytes, const PropertyListLimits& limits = {});

/// A binary property list in pieces, or one line that says why it cannot be written: the value exceeds what
/// `ownLimits` lets a reader accept, in depth or in expanded size. Large data objects are not copied: their
/// pieces are the value's own shared buffers.
struct PropertyListPieces {
  std::vector<SharedSlice> pieces;
  std::size_t size = 0;
  std::string error;
};
PropertyListPieces writeBinaryPropertyListPieces(const PropertyListValue& value);

/// The same as one buffer; absent with `error` set when it cannot be written.
struct PropertyListWriting {
  std::optional<Bytes> bytes;
  std::string error;
};
PropertyListWriting writeBinaryPropertyList(const PropertyListValue& value);

/// The human-readable rendering of a value, in the text encoding: what is printed reads back with the text
/// reader, numbers, booleans and dates as strings. No newline at the end.
std::string describe(const PropertyListValue& value);

/// The same for a log: cut, with a mark, at about `longest` bytes. Indentation alone can make a description
/// far larger than its value.
std::string describeBriefly(const PropertyListValue& value, std::size_t longest = 4096);

}  // namespace kel::platform
