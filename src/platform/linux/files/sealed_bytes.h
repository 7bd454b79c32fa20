#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "property_lists/bytes.h"

// How the small files that this program keeps for itself are coded: a line that names the format, a checksum,
// then numbers and strings. Numbers have seven bits a byte, the lowest first, the highest bit set on all but
// the last.
namespace kel::platform {

class ByteWriter {
 public:
  void number(std::uint64_t value);
  void fixed(std::uint64_t value);  ///< eight bytes, the lowest first: for what is rarely small
  void string(std::string_view text);
  void bytes(BytesView bytes) { bytes_.insert(bytes_.end(), bytes.begin(), bytes.end()); }

  /// All that was written, below the format's name and the checksum.
  Bytes sealed(std::string_view format) const;

 private:
  Bytes bytes_;
};

/// Reads what a `ByteWriter` wrote. Past the end, and from there on, all is 0 and empty and `failed` is true.
class ByteReader {
 public:
  /// The contents of a sealed file; absent when it has another format or was damaged. Borrows `file`.
  static std::optional<ByteReader> open(BytesView file, std::string_view format);

  std::uint64_t number();
  std::uint64_t fixed();
  std::string_view string();
  BytesView bytes(std::size_t count);

  /// How many elements follow, each of at least one byte: more than there are bytes left is a failure.
  std::size_t count();

  void fail() { failed_ = true; }
  bool failed() const { return failed_; }
  bool atEnd() const { return rest_.empty() && !failed_; }

 private:
  explicit ByteReader(BytesView contents) : rest_(contents) {}

  BytesView rest_;
  bool failed_ = false;
};

}  // namespace kel::platform
