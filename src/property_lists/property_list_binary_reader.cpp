// How a binary property list is read.
//
// A file is a row of objects, a table of their offsets, and a trailer that says how wide offsets and
// references are. A container holds references: indexes into the table. The reader begins with the top object
// and resolves what is referred to. A leaf becomes a value at once. A container is opened: it goes onto the
// stack `open_`, its keys and its finished values onto two more; when its last reference is resolved it is
// closed into a value. What nothing refers to is never looked at.
//
// `slots_` knows of every object whether it is unread, under construction or decoded. A decoded string, data
// or container is shared by all who refer to it; numbers are cheaper to decode again than to keep. A
// reference to what is under construction is a container within itself.
//
// Never happens: recursion, because a file may nest as deeply as it is long; a read outside the bytes,
// because every count is compared with the bytes that are left before anything is multiplied by it; work
// beyond the budget. Objects may overlap, and references share them, so that a small file can stand for a
// value larger than any memory. Therefore every byte decoded and every reference followed is charged. What is
// charged never exceeds the expanded size of the top value, so that nothing is refused for it that would not
// be refused at the end.

#include <algorithm>
#include <bit>
#include <cstring>

#include "property_lists/property_list.h"
#include "property_lists/property_list_parsing.h"
#include "property_lists/unicode.h"

namespace kel::platform {

namespace {

constexpr std::size_t headerSize = 8;
constexpr std::size_t trailerSize = 32;

using Malformed = MalformedPropertyList;

std::uint64_t bigEndianNumber(BytesView bytes) {
  std::uint64_t number = 0;
  for (const std::uint8_t byte : bytes) number = number << 8 | byte;
  return number;
}

class BinaryReader {
 public:
  BinaryReader(BytesView bytes, const PropertyListLimits& limits)
      : bytes_(bytes), budget_(limits, bytes.size()) {}

  PropertyListValue read() {
    const std::uint64_t top = readTrailer();
    slots_.resize(count_, unread);
    // The trailer's count is only bounded by the table: reserve no more than the bytes make likely.
    decoded_.reserve(std::min<std::size_t>(count_, bytes_.size() / 16));
    budget_.spend(PropertyListBudget::valueCost, headerSize);
    resolve(top, bytes_.size() - 16);
    while (!open_.empty()) {
      Container& container = open_.back();
      if (container.next == container.count) {
        close();
      } else {
        const std::size_t position = container.values + container.next++ * referenceSize_;
        resolve(number(position, referenceSize_), position);
      }
    }
    return std::move(values_.back());
  }

 private:
  // What `slots_` holds for an object: one of the first two, or `firstDecoded` plus an index into `decoded_`.
  static constexpr std::uint32_t unread = 0;
  static constexpr std::uint32_t underConstruction = 1;
  static constexpr std::uint32_t firstDecoded = 2;

  struct Container {
    std::uint64_t object;
    std::size_t position;  // of its marker
    bool isDictionary;
    std::size_t count;
    std::size_t values;  // position of the references to its values
    std::size_t next;
    std::size_t firstKey;
    std::size_t firstValue;
  };

  /// Checks the trailer; returns the index of the top object.
  std::uint64_t readTrailer() {
    if (bytes_.size() < headerSize + trailerSize) throw Malformed{bytes_.size(), "too short for a trailer"};
    if (std::memcmp(bytes_.data(), "bplist00", headerSize) != 0) throw Malformed{0, "\"bplist00\" expected"};
    const std::size_t trailer = bytes_.size() - trailerSize;
    offsetSize_ = bytes_[trailer + 6];
    referenceSize_ = bytes_[trailer + 7];
    if (offsetSize_ < 1 || offsetSize_ > 8) throw Malformed{trailer + 6, "offset size out of range"};
    if (referenceSize_ < 1 || referenceSize_ > 8) throw Malformed{trailer + 7, "reference size out of range"};
    count_ = number(trailer + 8, 8);
    const std::uint64_t top = number(trailer + 16, 8);
    const std::uint64_t table = number(trailer + 24, 8);
    if (table < headerSize || table > trailer) throw Malformed{trailer + 24, "offset table out of range"};
    objectsEnd_ = table;
    // Divided, not multiplied: the count may be any 64 bits.
    if (count_ > (trailer - objectsEnd_) / offsetSize_ || count_ >= UINT32_MAX - firstDecoded) {
      throw Malformed{trailer + 8, "more objects than the offset table has room for"};
    }
    return top;
  }

  std::uint64_t number(std::size_t position, std::size_t size) const {
    return bigEndianNumber(bytes_.subspan(position, size));
  }

  std::size_t positionOf(std::uint64_t object, std::size_t reference) const {
    if (object >= count_) throw Malformed{reference, "reference to an object that is not there"};
    const std::size_t entry = objectsEnd_ + object * offsetSize_;
    const std::uint64_t position = number(entry, offsetSize_);
    if (position < headerSize || position >= objectsEnd_) throw Malformed{entry, "offset out of range"};
    return position;
  }

  /// Pushes the value of `object`, or begins its construction. `reference` is where it was referred to.
  void resolve(std::uint64_t object, std::size_t reference) {
    const std::size_t position = positionOf(object, reference);
    const std::uint32_t slot = slots_[object];
    if (slot == underConstruction) throw Malformed{reference, "a container that contains itself"};
    if (slot >= firstDecoded) {
      values_.push_back(decoded_[slot - firstDecoded]);
      return;
    }
    const std::uint8_t kind = bytes_[position] >> 4;
    if (kind == 0xA || kind == 0xD) {
      open(object, position, kind == 0xD);
    } else {
      PropertyListValue value = leaf(position);
      if (value.asSharedString() || value.asData()) {
        budget_.spend(value.expandedSize() - PropertyListBudget::valueCost, position);
        remember(object, value);
      }
      values_.push_back(std::move(value));
    }
  }

  void remember(std::uint64_t object, const PropertyListValue& value) {
    slots_[object] = static_cast<std::uint32_t>(decoded_.size()) + firstDecoded;
    decoded_.push_back(value);
  }

  void open(std::uint64_t object, std::size_t position, bool isDictionary) {
    budget_.checkDepth(open_.size() + 1, position);
    std::size_t references = position;
    const std::size_t count = readCount(references, isDictionary ? 2 * referenceSize_ : referenceSize_);
    budget_.spend(count * PropertyListBudget::valueCost, position);
    slots_[object] = underConstruction;
    const std::size_t values = isDictionary ? references + count * referenceSize_ : references;
    open_.push_back({object, position, isDictionary, count, values, 0, keys_.size(), values_.size()});
    if (!isDictionary) return;
    for (; references < values; references += referenceSize_) keys_.push_back(key(references));
  }

  PropertyListString key(std::size_t reference) {
    const std::uint64_t object = number(reference, referenceSize_);
    const std::size_t position = positionOf(object, reference);
    if (slots_[object] < firstDecoded) {
      const std::uint8_t kind = bytes_[position] >> 4;
      if (kind != 5 && kind != 6) throw Malformed{reference, "a key that is not a string"};
      remember(object, leaf(position));
    }
    const PropertyListString* key = decoded_[slots_[object] - firstDecoded].asSharedString();
    if (!key) throw Malformed{reference, "a key that is not a string"};
    budget_.spend(key->text().size() + PropertyListBudget::valueCost, reference);
    return *key;
  }

  void close() {
    const Container closed = open_.back();
    open_.pop_back();
    const PropertyListValue value =
        closed.isDictionary
            ? PropertyListValue(takeDictionary(keys_, closed.firstKey, values_, closed.firstValue))
            : PropertyListValue(takeArray(values_, closed.firstValue));
    // Again, for what it refers to may have been decoded elsewhere, at less depth.
    budget_.checkDepth(value.depth(), closed.position);
    budget_.checkSize(value.expandedSize(), closed.position);
    remember(closed.object, value);
    values_.push_back(value);
  }

  /// The count of a string, data or container whose marker is at `position`, which moves behind it; each of
  /// what it counts takes `size` bytes, and all of them lie before the offset table.
  std::size_t readCount(std::size_t& position, std::size_t size) const {
    const std::size_t marker = position++;
    std::uint64_t count = bytes_[marker] & 0xF;
    if (count == 0xF) {
      if (position >= objectsEnd_ || bytes_[position] >> 4 != 1) throw Malformed{position, "count expected"};
      const PropertyListInteger integer = readInteger(position);
      if (integer.isNegative) throw Malformed{marker, "negative count"};
      count = integer.bits;
    }
    if (count > (objectsEnd_ - position) / size) throw Malformed{marker, "longer than the objects' bytes"};
    return count;
  }

  /// The `size` bytes at `position`, which moves behind them.
  BytesView take(std::size_t& position, std::size_t size) const {
    if (size > objectsEnd_ - position) throw Malformed{position, "longer than the objects' bytes"};
    position += size;
    return bytes_.subspan(position - size, size);
  }

  PropertyListInteger readInteger(std::size_t& position) const {
    const std::size_t marker = position++;
    const std::uint8_t exponent = bytes_[marker] & 0xF;
    if (exponent > 4) throw Malformed{marker, "integer of unknown size"};
    const BytesView bytes = take(position, std::size_t{1} << exponent);
    if (exponent < 3) return {bigEndianNumber(bytes), false};
    const std::uint64_t low = bigEndianNumber(bytes.last(8));
    const bool lowIsNegative = low >> 63 != 0;
    if (exponent == 3) return {low, lowIsNegative};
    const std::uint64_t high = bigEndianNumber(bytes.first(8));
    if (high != 0 && !(high == UINT64_MAX && lowIsNegative)) {
      throw Malformed{marker, "integer beyond 64 bits"};
    }
    return {low, high != 0};
  }

  /// The object at `position`, which is no container.
  PropertyListValue leaf(std::size_t position) const {
    const std::uint8_t marker = bytes_[position];
    switch (marker >> 4) {
      case 0x0:
        if (marker == 0x08 || marker == 0x09) return marker == 0x09;
        break;
      case 0x1:
        return readInteger(position);
      case 0x2:
        if (marker == 0x22) {
          const auto bits = static_cast<std::uint32_t>(bigEndianNumber(take(++position, 4)));
          return static_cast<double>(std::bit_cast<float>(bits));
        }
        if (marker == 0x23) return readReal(position);
        break;
      case 0x3:
        if (marker == 0x33) return PropertyListDate{readReal(position)};
        break;
      case 0x4: {
        const BytesView data = take(position, readCount(position, 1));
        return Bytes(data.begin(), data.end());
      }
      case 0x5:
        return readASCII(position);
      case 0x6:
        return readUTF16(position);
      default:
        break;
    }
    constexpr const char* digits = "0123456789abcdef";
    throw Malformed{position, std::string("unknown object 0x") + digits[marker >> 4] + digits[marker & 0xF]};
  }

  double readReal(std::size_t& position) const {
    return std::bit_cast<double>(bigEndianNumber(take(++position, 8)));
  }

  PropertyListString readASCII(std::size_t position) const {
    const std::size_t marker = position;
    const std::size_t count = readCount(position, 1);
    const std::string_view text(reinterpret_cast<const char*>(bytes_.data()) + position, count);
    if (!isASCII(text)) throw Malformed{marker, "ASCII string with other characters"};
    return text;
  }

  PropertyListString readUTF16(std::size_t position) const {
    const std::size_t marker = position;
    const std::size_t count = readCount(position, 2);
    auto text = utf8FromUTF16(bytes_.subspan(position, 2 * count), true);
    if (!text) throw Malformed{marker, "UTF-16 string with a lone surrogate"};
    return std::move(*text);
  }

  const BytesView bytes_;
  PropertyListBudget budget_;

  // From the trailer.
  std::size_t offsetSize_ = 0;
  std::size_t referenceSize_ = 0;
  std::uint64_t count_ = 0;
  std::size_t objectsEnd_ = 0;  // position of the offset table

  std::vector<std::uint32_t> slots_;
  std::vector<PropertyListValue> decoded_;  // strings, data and containers, which may be shared
  std::vector<Container> open_;             // the innermost last
  std::vector<PropertyListString> keys_;
  std::vector<PropertyListValue> values_;
};

}  // namespace

PropertyListReading readBinaryPropertyList(BytesView bytes, const PropertyListLimits& limits) {
  try {
    return {BinaryReader(bytes, limits).read(), {}};
  } catch (const MalformedPropertyList& malformed) {
    return {std::nullopt, "byte " + std::to_string(malformed.position) + ": " + malformed.what};
  }
}

}  // namespace kel::platform
