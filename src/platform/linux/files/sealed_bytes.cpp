#include "platform/linux/files/sealed_bytes.h"

#include <algorithm>

#include "property_lists/digest.h"

namespace kel::platform {

void ByteWriter::number(std::uint64_t value) {
  for (; value >= 0x80; value >>= 7) bytes_.push_back(static_cast<std::uint8_t>(value | 0x80));
  bytes_.push_back(static_cast<std::uint8_t>(value));
}

void ByteWriter::fixed(std::uint64_t value) {
  for (int shift = 0; shift < 64; shift += 8) bytes_.push_back(static_cast<std::uint8_t>(value >> shift));
}

void ByteWriter::string(std::string_view text) {
  number(text.size());
  bytes_.insert(bytes_.end(), text.begin(), text.end());
}

Bytes ByteWriter::sealed(std::string_view format) const {
  Bytes file(format.begin(), format.end());
  file.push_back('\n');
  const Digest checksum = md5(bytes_);
  file.insert(file.end(), checksum.begin(), checksum.end());
  file.insert(file.end(), bytes_.begin(), bytes_.end());
  return file;
}

std::optional<ByteReader> ByteReader::open(BytesView file, std::string_view format) {
  const std::size_t start = format.size() + 1 + sizeof(Digest);
  if (file.size() < start || !std::equal(format.begin(), format.end(), file.begin()) ||
      file[format.size()] != '\n') {
    return std::nullopt;
  }
  // Against half-written and damaged files, not against forgers: whoever can write here may do so anyway.
  const BytesView contents = file.subspan(start);
  const Digest checksum = md5(contents);
  if (!std::equal(checksum.begin(), checksum.end(), file.begin() + static_cast<std::ptrdiff_t>(start - 16))) {
    return std::nullopt;
  }
  return ByteReader(contents);
}

std::uint64_t ByteReader::number() {
  std::uint64_t value = 0;
  for (int shift = 0; shift < 64; shift += 7) {
    const BytesView byte = bytes(1);
    if (byte.empty()) return 0;
    value |= static_cast<std::uint64_t>(byte[0] & 0x7f) << shift;
    if (byte[0] < 0x80) return value;
  }
  fail();
  return 0;
}

std::uint64_t ByteReader::fixed() {
  std::uint64_t value = 0;
  int shift = 0;
  for (const std::uint8_t byte : bytes(8)) {
    value |= static_cast<std::uint64_t>(byte) << shift;
    shift += 8;
  }
  return value;
}

std::string_view ByteReader::string() {
  const BytesView text = bytes(count());
  return {reinterpret_cast<const char*>(text.data()), text.size()};
}

BytesView ByteReader::bytes(std::size_t count) {
  if (failed_ || count > rest_.size()) {
    fail();
    return {};
  }
  const BytesView taken = rest_.first(count);
  rest_ = rest_.subspan(count);
  return taken;
}

std::size_t ByteReader::count() {
  const std::uint64_t value = number();
  // Checked here, so that no caller reserves memory for what a few bytes only claim.
  if (value > rest_.size()) fail();
  return failed_ ? 0 : static_cast<std::size_t>(value);
}

}  // namespace kel::platform
