#pragma once

#include <compare>
#include <concepts>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

#include "property_lists/bytes.h"

namespace kel::platform {

class PropertyListDictionary;
class PropertyListValue;
using PropertyListArray = std::vector<PropertyListValue>;

/// An immutable, shared UTF-8 string; a copy costs a reference count. Compared by contents, byte by byte.
class PropertyListString {
 public:
  PropertyListString() : PropertyListString(std::string()) {}
  PropertyListString(std::string text) : text_(std::make_shared<const std::string>(std::move(text))) {}
  PropertyListString(std::string_view text) : PropertyListString(std::string(text)) {}
  PropertyListString(const char* text) : PropertyListString(std::string(text)) {}

  const std::string& text() const { return *text_; }
  operator std::string_view() const { return *text_; }

  bool operator==(const PropertyListString& other) const {
    return text_ == other.text_ || *text_ == *other.text_;
  }
  std::strong_ordering operator<=>(const PropertyListString& other) const {
    return text_ == other.text_ ? std::strong_ordering::equal : text().compare(other.text()) <=> 0;
  }

 private:
  std::shared_ptr<const std::string> text_;
};

/// An integer in the whole range of signed and unsigned 64 bits: `bits` is the value, or its two's complement
/// when `isNegative`.
struct PropertyListInteger {
  std::uint64_t bits = 0;
  bool isNegative = false;

  bool operator==(const PropertyListInteger&) const = default;
};

/// A point in time, in seconds since 2001-01-01 00:00:00 UTC.
struct PropertyListDate {
  double secondsSince2001 = 0;
};

/// One property-list value, message or dictionary of the system. Immutable and shared: a copy costs a
/// reference count, any thread may read it. Equality is deep and tells kinds apart: the integer 1, the
/// real 1.0 and true differ; reals and dates are equal when their bits are.
class PropertyListValue {
 public:
  enum class Kind { String, Boolean, Integer, Real, Data, Date, Array, Dictionary };

  PropertyListValue(PropertyListString value) : value_(std::move(value)) {}
  PropertyListValue(std::string value) : value_(PropertyListString(std::move(value))) {}
  PropertyListValue(std::string_view value) : value_(PropertyListString(value)) {}
  PropertyListValue(const char* value) : value_(PropertyListString(value)) {}
  template <std::same_as<bool> T>
  PropertyListValue(T value) : value_(value) {}
  template <std::integral T>
  requires(!std::same_as<T, bool>) PropertyListValue(T value)
      : value_(PropertyListInteger{static_cast<std::uint64_t>(value), value < 0}) {}
  PropertyListValue(PropertyListInteger value) : value_(value) {}
  PropertyListValue(double value) : value_(value) {}
  PropertyListValue(Bytes value) : value_(std::make_shared<const Bytes>(std::move(value))) {}
  PropertyListValue(SharedBytes value) : value_(std::move(value)) {}
  PropertyListValue(PropertyListDate value) : value_(value) {}
  PropertyListValue(PropertyListArray value);
  PropertyListValue(PropertyListDictionary value);

  Kind kind() const { return static_cast<Kind>(value_.index()); }

  /// True for integers, reals and booleans.
  bool isNumber() const { return kind() == Kind::Boolean || kind() == Kind::Integer || kind() == Kind::Real; }

  // The value when it is of the kind asked for, else null or absent. Pointers live as long as this value or a
  // copy of it does.
  const std::string* asString() const;
  const PropertyListString* asSharedString() const { return std::get_if<PropertyListString>(&value_); }
  std::optional<bool> asBoolean() const;
  std::optional<PropertyListInteger> asInteger() const;
  std::optional<double> asReal() const;
  std::optional<PropertyListDate> asDate() const;
  const SharedBytes* asData() const { return std::get_if<SharedBytes>(&value_); }
  const PropertyListArray* asArray() const;
  const PropertyListDictionary* asDictionary() const;

  /// A number's value as an unsigned 64-bit integer: a boolean gives 0 or 1, a negative integer its two's
  /// complement, a real its whole part clamped to the range (0 for not a number). Absent for other kinds.
  std::optional<std::uint64_t> asUnsigned64() const;

  /// How large the value is when every shared part is counted wherever it occurs: bytes of text and data plus
  /// a constant per value, saturating. Known without a walk. Sharing in a hostile file can make this
  /// exponentially larger than the file.
  std::uint64_t expandedSize() const;

  /// Levels of containers, 0 for a value that is none. Known without a walk.
  std::uint32_t depth() const;

  /// The address that stands for the value's kind in messages: the same for every value of one kind.
  const void* typeAddress() const;

  bool operator==(const PropertyListValue& other) const;

 private:
  struct ArrayNode;
  struct DictionaryNode;

  std::variant<PropertyListString, bool, PropertyListInteger, double, SharedBytes, PropertyListDate,
               std::shared_ptr<const ArrayNode>, std::shared_ptr<const DictionaryNode>>
      value_;
};

/// A dictionary with string keys in ascending order, each once. Immutable once built.
class PropertyListDictionary {
 public:
  using Entry = std::pair<PropertyListString, PropertyListValue>;

  PropertyListDictionary() = default;

  /// Sorts `entries`; of several with one key the last stays.
  explicit PropertyListDictionary(std::vector<Entry> entries);

  /// The value under `key`, or null.
  const PropertyListValue* find(std::string_view key) const;
  std::size_t size() const { return entries_.size(); }
  bool empty() const { return entries_.empty(); }
  auto begin() const { return entries_.begin(); }
  auto end() const { return entries_.end(); }

  bool operator==(const PropertyListDictionary&) const = default;

 private:
  std::vector<Entry> entries_;
};

/// A dictionary under construction. Not shared between threads.
class PropertyListDictionaryBuilder {
 public:
  PropertyListDictionaryBuilder() = default;
  explicit PropertyListDictionaryBuilder(const PropertyListDictionary& dictionary)
      : entries_(dictionary.begin(), dictionary.end()) {}

  /// Stores `value` under `key`, in place of one already there.
  void set(PropertyListString key, PropertyListValue value) {
    entries_.insert_or_assign(std::move(key), std::move(value));
  }

  /// The value under `key`, or null; valid until the key is set again.
  const PropertyListValue* find(std::string_view key) const {
    const auto found = entries_.find(key);
    return found == entries_.end() ? nullptr : &found->second;
  }

  std::size_t size() const { return entries_.size(); }

  /// The `expandedSize` of the dictionary as it stands; takes a walk over its keys.
  std::uint64_t expandedSize() const;

  /// The finished dictionary; the builder stays as it is.
  PropertyListDictionary build() const;

 private:
  struct ByText {
    using is_transparent = void;
    bool operator()(std::string_view a, std::string_view b) const { return a < b; }
  };
  std::map<PropertyListString, PropertyListValue, ByText> entries_;
};

/// What `kind`, one of the `as...` of a value, gives of the value under `key`; null or absent when there is
/// none. `dictionary` is whatever has a `find` like the two above, and keeps the value alive.
template <auto kind>
auto typed_value(const auto& dictionary, std::string_view key) {
  const PropertyListValue* value = dictionary.find(key);
  return value ? (value->*kind)() : decltype((value->*kind)())();
}
const std::string* string_value(const auto& dictionary, std::string_view key) {
  return typed_value<&PropertyListValue::asString>(dictionary, key);
}
const PropertyListString* shared_string_value(const auto& dictionary, std::string_view key) {
  return typed_value<&PropertyListValue::asSharedString>(dictionary, key);
}
const PropertyListArray* array_value(const auto& dictionary, std::string_view key) {
  return typed_value<&PropertyListValue::asArray>(dictionary, key);
}
const PropertyListDictionary* dictionary_value(const auto& dictionary, std::string_view key) {
  return typed_value<&PropertyListValue::asDictionary>(dictionary, key);
}

/// A copy of what `pointer` points to; none for null.
template <typename T>
std::optional<T> copied(const T* pointer) {
  return pointer ? std::optional<T>(*pointer) : std::nullopt;
}

}  // namespace kel::platform
