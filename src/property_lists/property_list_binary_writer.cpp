// How a binary property list is written.
//
// In two passes. The first numbers the objects, breadth first: `objects_` is at once the list of objects and
// the queue of containers to look into, each of which adds what it refers to at the end. `references_`
// gathers the numbers by which containers refer, one container's behind the other's. The second pass writes
// the objects by number, takes each container's references off the front of that row, and ends with offsets
// and trailer; the widths of both, the smallest that serve, are known by then.
//
// Equal strings, numbers, booleans, dates and data are one object. `byContents_` finds it by a hash under a
// key of this process, so that no bundle can choose texts that collide; the full comparison decides.
// `byAddress_` is asked first: a part that is shared, as the keys of a thousand services are, is hashed once.
// Containers are never made one: to compare them would cost more than the bytes it saves.
//
// Never happens: other bytes for an equal value, because numbers follow from the contents and their order
// alone and never from what is shared, from addresses or from the hash; a file that this program's reader
// refuses, because depth and expanded size are checked before anything is written; a number beyond 32 bits,
// for the same reason; a copy of large data when the result is made in pieces: the value's own buffer is one
// of them.

#include <algorithm>
#include <bit>
#include <variant>

#include "property_lists/keyed_hash.h"
#include "property_lists/property_list.h"
#include "property_lists/property_list_parsing.h"
#include "property_lists/unicode.h"

namespace kel::platform {

namespace {

/// Data objects above this size become pieces of their own instead of being copied.
constexpr std::size_t largeData = 4096;

/// Object numbers by hash, with open addressing.
class NumberTable {
 public:
  /// The number stored under `hash` for which `matches(number)` holds; stores `number` when there is none.
  /// Valid until the next call.
  template <typename Matches>
  std::uint32_t& findOrAdd(std::uint64_t hash, std::uint32_t number, Matches matches) {
    if (2 * count_ >= slots_.size()) grow();
    Slot& slot = slots_[indexOf(hash, matches)];
    if (slot.isFree()) {
      slot = {hash, number};
      ++count_;
    }
    return slot.number;
  }

 private:
  struct Slot {
    std::uint64_t hash = 0;
    std::uint32_t number = UINT32_MAX;

    bool isFree() const { return number == UINT32_MAX; }
  };

  template <typename Matches>
  std::size_t indexOf(std::uint64_t hash, Matches matches) const {
    const std::size_t mask = slots_.size() - 1;
    std::size_t index = (hash ^ hash >> 32) & mask;
    while (!slots_[index].isFree() && !(slots_[index].hash == hash && matches(slots_[index].number))) {
      index = (index + 1) & mask;
    }
    return index;
  }

  void grow() {
    const std::vector<Slot> old = std::move(slots_);
    slots_ = std::vector<Slot>(std::max<std::size_t>(64, 2 * old.size()));
    for (const Slot& slot : old) {
      if (!slot.isFree()) slots_[indexOf(slot.hash, [](std::uint32_t) { return false; })] = slot;
    }
  }

  std::vector<Slot> slots_;
  std::size_t count_ = 0;
};

class BinaryWriter {
 public:
  explicit BinaryWriter(std::size_t largestCopied) : largestCopied_(largestCopied) {}

  void write(const PropertyListValue& top) {
    numberObjects(top);
    append("bplist00");
    const std::size_t referenceSize = sizeFor(objects_.size() - 1);
    const std::uint32_t* references = references_.data();
    std::vector<std::uint64_t> offsets;
    offsets.reserve(objects_.size());
    for (const Object& object : objects_) {
      offsets.push_back(size());
      references = writeObject(object, references, referenceSize);
    }
    const std::uint64_t offsetTable = size();
    const std::size_t offsetSize = sizeFor(offsets.back());
    appendNumbers(offsets.data(), offsets.size(), offsetSize);
    appendNumber(0, 6);
    appendNumber(offsetSize, 1);
    appendNumber(referenceSize, 1);
    appendNumber(objects_.size(), 8);
    appendNumber(0, 8);
    appendNumber(offsetTable, 8);
  }

  /// What was written, when nothing was too large to be copied.
  Bytes takeBytes() { return std::move(buffer_); }

  PropertyListPieces takePieces() {
    const std::size_t total = size();
    endPiece();
    return {std::move(pieces_), total, {}};
  }

 private:
  // Keys are strings that belong to no value, therefore strings stand for themselves.
  using Object = std::variant<const std::string*, const PropertyListValue*>;

  void numberObjects(const PropertyListValue& top) {
    // The trailer names object 0 as the top one.
    if (top.asArray() || top.asDictionary()) {
      objects_.push_back(&top);
    } else {
      numberOf(top);
    }
    for (std::size_t i = 0; i < objects_.size(); ++i) {
      if (objects_[i].index() == 0) continue;
      const PropertyListValue& value = *std::get<1>(objects_[i]);
      if (const PropertyListArray* array = value.asArray()) {
        for (const PropertyListValue& element : *array) references_.push_back(numberOf(element));
      } else if (const PropertyListDictionary* dictionary = value.asDictionary()) {
        for (const auto& [key, _] : *dictionary) references_.push_back(numberOf(key.text()));
        for (const auto& [_, element] : *dictionary) references_.push_back(numberOf(element));
      }
    }
  }

  std::uint32_t numberOf(const PropertyListValue& value) {
    using Kind = PropertyListValue::Kind;
    switch (value.kind()) {
      case Kind::String:
        return numberOf(*value.asString());
      case Kind::Data:
        return numberShared(value.asData()->get(), &value, [&] { return keyedHash(**value.asData()); });
      case Kind::Boolean: {
        std::optional<std::uint32_t>& number = booleans_[*value.asBoolean() ? 1 : 0];
        if (!number) number = add(&value);
        return *number;
      }
      case Kind::Integer:
        return numberScalar(value.asInteger()->bits, value);
      case Kind::Real:
        return numberScalar(std::bit_cast<std::uint64_t>(*value.asReal()), value);
      case Kind::Date:
        return numberScalar(std::bit_cast<std::uint64_t>(value.asDate()->secondsSince2001), value);
      case Kind::Array:
      case Kind::Dictionary:
        break;
    }
    return add(&value);
  }

  std::uint32_t numberOf(const std::string& text) {
    return numberShared(&text, &text, [&] {
      return keyedHash({reinterpret_cast<const std::uint8_t*>(text.data()), text.size()});
    });
  }

  /// Looks an object up by `address` first: for a part that is shared, its contents are never looked at.
  template <typename Hash>
  std::uint32_t numberShared(const void* address, Object object, Hash hash) {
    // Multiplying by an odd number maps different addresses to different hashes.
    const std::uint64_t addressHash = reinterpret_cast<std::uintptr_t>(address) * 0x9E3779B97F4A7C15U;
    const auto fresh = static_cast<std::uint32_t>(objects_.size());
    std::uint32_t& number = byAddress_.findOrAdd(addressHash, fresh, [](std::uint32_t) { return true; });
    if (number == fresh) number = numberByContents(hash(), object);
    return number;
  }

  std::uint32_t numberScalar(std::uint64_t bits, const PropertyListValue& value) {
    // With its kind: the integer 1 and the date of the same bits are two objects.
    std::uint8_t bytes[9] = {static_cast<std::uint8_t>(value.kind())};
    for (std::size_t i = 0; i < 8; ++i) bytes[1 + i] = static_cast<std::uint8_t>(bits >> 8 * i);
    return numberByContents(keyedHash(bytes), &value);
  }

  std::uint32_t numberByContents(std::uint64_t hash, Object object) {
    const auto fresh = static_cast<std::uint32_t>(objects_.size());
    const std::uint32_t number = byContents_.findOrAdd(
        hash, fresh, [&](std::uint32_t known) { return equal(objects_[known], object); });
    return number == fresh ? add(object) : number;
  }

  static bool equal(const Object& a, const Object& b) {
    if (a.index() != b.index()) return false;
    return a.index() == 0 ? *std::get<0>(a) == *std::get<0>(b) : *std::get<1>(a) == *std::get<1>(b);
  }

  std::uint32_t add(Object object) {
    objects_.push_back(object);
    return static_cast<std::uint32_t>(objects_.size() - 1);
  }

  /// Returns the references behind those of `object`.
  const std::uint32_t* writeObject(const Object& object, const std::uint32_t* references,
                                   std::size_t referenceSize) {
    using Kind = PropertyListValue::Kind;
    if (object.index() == 0) {
      writeString(*std::get<0>(object));
      return references;
    }
    const PropertyListValue& value = *std::get<1>(object);
    switch (value.kind()) {
      case Kind::String:
        break;
      case Kind::Boolean:
        appendNumber(*value.asBoolean() ? 0x09 : 0x08, 1);
        break;
      case Kind::Integer:
        writeInteger(*value.asInteger());
        break;
      case Kind::Real:
        appendNumber(0x23, 1);
        appendNumber(std::bit_cast<std::uint64_t>(*value.asReal()), 8);
        break;
      case Kind::Date:
        appendNumber(0x33, 1);
        appendNumber(std::bit_cast<std::uint64_t>(value.asDate()->secondsSince2001), 8);
        break;
      case Kind::Data:
        writeData(*value.asData());
        break;
      case Kind::Array:
        writeMarker(0xA0, value.asArray()->size());
        return writeReferences(references, value.asArray()->size(), referenceSize);
      case Kind::Dictionary:
        writeMarker(0xD0, value.asDictionary()->size());
        return writeReferences(references, 2 * value.asDictionary()->size(), referenceSize);
    }
    return references;
  }

  const std::uint32_t* writeReferences(const std::uint32_t* references, std::size_t count, std::size_t size) {
    appendNumbers(references, count, size);
    return references + count;
  }

  void writeMarker(std::uint8_t kind, std::uint64_t count) {
    appendNumber(kind | std::min<std::uint64_t>(count, 0xF), 1);
    if (count >= 0xF) writeInteger({count, false});
  }

  void writeInteger(PropertyListInteger integer) {
    // Eight bytes are read as signed.
    if (!integer.isNegative && integer.bits >> 63 != 0) {
      appendNumber(0x14, 1);
      appendNumber(0, 8);
      appendNumber(integer.bits, 8);
      return;
    }
    const std::size_t size = integer.isNegative ? 8 : sizeFor(integer.bits);
    appendNumber(0x10 | static_cast<unsigned>(std::countr_zero(size)), 1);
    appendNumber(integer.bits, size);
  }

  void writeString(const std::string& text) {
    if (isASCII(text)) {
      writeMarker(0x50, text.size());
      append(text);
      return;
    }
    writeMarker(0x60, utf16Length(text));
    for (std::size_t position = 0; position < text.size();) {
      const char32_t character = nextCharacter(text, position);
      if (character < 0x10000) {
        appendNumber(character, 2);
      } else {
        appendNumber(0xD800 + ((character - 0x10000) >> 10), 2);
        appendNumber(0xDC00 + ((character - 0x10000) & 0x3FF), 2);
      }
    }
  }

  void writeData(const SharedBytes& data) {
    writeMarker(0x40, data->size());
    if (data->size() <= largestCopied_) {
      buffer_.insert(buffer_.end(), data->begin(), data->end());
      return;
    }
    endPiece();
    pieces_.push_back({data, 0, data->size()});
    inPieces_ += data->size();
  }

  void endPiece() {
    if (buffer_.empty()) return;
    const std::size_t length = buffer_.size();
    pieces_.push_back({std::make_shared<const Bytes>(std::move(buffer_)), 0, length});
    buffer_ = {};
    inPieces_ += length;
  }

  /// Bytes written so far.
  std::size_t size() const { return inPieces_ + buffer_.size(); }

  static std::size_t sizeFor(std::uint64_t number) {
    return number <= 0xFF ? 1 : number <= 0xFFFF ? 2 : number <= 0xFFFFFFFF ? 4 : 8;
  }

  void appendNumber(std::uint64_t number, std::size_t size) {
    if (size == 1) {
      buffer_.push_back(static_cast<std::uint8_t>(number));
    } else {
      appendNumbers(&number, 1, size);
    }
  }

  template <typename Number>
  void appendNumbers(const Number* numbers, std::size_t count, std::size_t size) {
    const std::size_t end = buffer_.size();
    buffer_.resize(end + count * size);
    std::uint8_t* next = buffer_.data() + end;
    for (std::size_t n = 0; n < count; ++n) {
      for (std::size_t i = size; i-- > 0;) {
        *next++ = static_cast<std::uint8_t>(static_cast<std::uint64_t>(numbers[n]) >> 8 * i);
      }
    }
  }

  void append(std::string_view text) { buffer_.insert(buffer_.end(), text.begin(), text.end()); }

  const std::size_t largestCopied_;

  std::vector<Object> objects_;
  std::vector<std::uint32_t> references_;
  std::optional<std::uint32_t> booleans_[2];
  NumberTable byAddress_;
  NumberTable byContents_;

  std::vector<SharedSlice> pieces_;
  std::size_t inPieces_ = 0;
  Bytes buffer_;  // what comes after `pieces_`
};

/// Why `value` cannot be written; empty when it can.
std::string refusal(const PropertyListValue& value) {
  constexpr std::uint32_t deepest = PropertyListLimits{}.depth;
  if (value.depth() > deepest) return "the value nests deeper than " + std::to_string(deepest) + " levels";
  if (value.expandedSize() > *ownLimits.expandedSize) {
    return "the value expands to more than " + std::to_string(*ownLimits.expandedSize) + " bytes";
  }
  return {};
}

}  // namespace

PropertyListPieces writeBinaryPropertyListPieces(const PropertyListValue& value) {
  if (std::string error = refusal(value); !error.empty()) return {{}, 0, std::move(error)};
  BinaryWriter writer(largeData);
  writer.write(value);
  return writer.takePieces();
}

PropertyListWriting writeBinaryPropertyList(const PropertyListValue& value) {
  if (std::string error = refusal(value); !error.empty()) return {std::nullopt, std::move(error)};
  BinaryWriter writer(SIZE_MAX);
  writer.write(value);
  return {writer.takeBytes(), {}};
}

}  // namespace kel::platform
