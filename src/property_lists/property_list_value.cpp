#include "property_lists/property_list_value.h"

#include <algorithm>
#include <array>
#include <bit>
#include <cmath>
#include <limits>

namespace kel::platform {

namespace {

// A value's expanded size and depth are summed up when it is built. Nobody who holds a value that came from
// outside need walk it to learn that it is too large to be walked.
constexpr std::uint64_t valueCost = 8;

std::uint64_t addSaturating(std::uint64_t a, std::uint64_t b) {
  const std::uint64_t sum = a + b;
  return sum < a ? std::numeric_limits<std::uint64_t>::max() : sum;
}

std::uint64_t entrySize(const PropertyListString& key, const PropertyListValue& value) {
  return addSaturating(key.text().size() + valueCost, value.expandedSize());
}

}  // namespace

struct PropertyListValue::ArrayNode {
  explicit ArrayNode(PropertyListArray values) : elements(std::move(values)) {
    for (const PropertyListValue& element : elements) {
      expandedSize = addSaturating(expandedSize, element.expandedSize());
      depth = std::max(depth, element.depth() + 1);
    }
  }

  PropertyListArray elements;
  std::uint64_t expandedSize = valueCost;
  std::uint32_t depth = 1;
};

struct PropertyListValue::DictionaryNode {
  explicit DictionaryNode(PropertyListDictionary values) : dictionary(std::move(values)) {
    for (const auto& [key, value] : dictionary) {
      expandedSize = addSaturating(expandedSize, entrySize(key, value));
      depth = std::max(depth, value.depth() + 1);
    }
  }

  PropertyListDictionary dictionary;
  std::uint64_t expandedSize = valueCost;
  std::uint32_t depth = 1;
};

PropertyListValue::PropertyListValue(PropertyListArray value)
    : value_(std::make_shared<const ArrayNode>(std::move(value))) {}

PropertyListValue::PropertyListValue(PropertyListDictionary value)
    : value_(std::make_shared<const DictionaryNode>(std::move(value))) {}

const std::string* PropertyListValue::asString() const {
  const auto* string = std::get_if<PropertyListString>(&value_);
  return string ? &string->text() : nullptr;
}

std::optional<bool> PropertyListValue::asBoolean() const {
  const bool* value = std::get_if<bool>(&value_);
  return value ? std::optional(*value) : std::nullopt;
}

std::optional<PropertyListInteger> PropertyListValue::asInteger() const {
  const auto* value = std::get_if<PropertyListInteger>(&value_);
  return value ? std::optional(*value) : std::nullopt;
}

std::optional<double> PropertyListValue::asReal() const {
  const double* value = std::get_if<double>(&value_);
  return value ? std::optional(*value) : std::nullopt;
}

std::optional<PropertyListDate> PropertyListValue::asDate() const {
  const auto* value = std::get_if<PropertyListDate>(&value_);
  return value ? std::optional(*value) : std::nullopt;
}

const PropertyListArray* PropertyListValue::asArray() const {
  const auto* node = std::get_if<std::shared_ptr<const ArrayNode>>(&value_);
  return node ? &(*node)->elements : nullptr;
}

const PropertyListDictionary* PropertyListValue::asDictionary() const {
  const auto* node = std::get_if<std::shared_ptr<const DictionaryNode>>(&value_);
  return node ? &(*node)->dictionary : nullptr;
}

std::optional<std::uint64_t> PropertyListValue::asUnsigned64() const {
  if (const auto boolean = asBoolean()) return *boolean ? 1 : 0;
  if (const auto integer = asInteger()) return integer->bits;
  if (const auto real = asReal()) {
    // Not a number, too; and what is out of range must not be cast.
    if (!(*real > 0)) return 0;
    return *real >= 0x1p64 ? std::numeric_limits<std::uint64_t>::max() : static_cast<std::uint64_t>(*real);
  }
  return std::nullopt;
}

std::uint64_t PropertyListValue::expandedSize() const {
  switch (kind()) {
    case Kind::String:
      return asString()->size() + valueCost;
    case Kind::Data:
      return (*asData())->size() + valueCost;
    case Kind::Array:
      return std::get<std::shared_ptr<const ArrayNode>>(value_)->expandedSize;
    case Kind::Dictionary:
      return std::get<std::shared_ptr<const DictionaryNode>>(value_)->expandedSize;
    default:
      return valueCost;
  }
}

std::uint32_t PropertyListValue::depth() const {
  if (kind() == Kind::Array) return std::get<std::shared_ptr<const ArrayNode>>(value_)->depth;
  if (kind() == Kind::Dictionary) return std::get<std::shared_ptr<const DictionaryNode>>(value_)->depth;
  return 0;
}

const void* PropertyListValue::typeAddress() const {
  static constexpr std::array<char, 8> types{};
  return &types[value_.index()];
}

bool PropertyListValue::operator==(const PropertyListValue& other) const {
  if (kind() != other.kind()) return false;
  switch (kind()) {
    case Kind::Real:
      return std::bit_cast<std::uint64_t>(*asReal()) == std::bit_cast<std::uint64_t>(*other.asReal());
    case Kind::Date:
      return std::bit_cast<std::uint64_t>(asDate()->secondsSince2001) ==
             std::bit_cast<std::uint64_t>(other.asDate()->secondsSince2001);
    // Shared parts are equal without being looked at.
    case Kind::Data:
      return *asData() == *other.asData() || **asData() == **other.asData();
    case Kind::Array:
      return asArray() == other.asArray() || *asArray() == *other.asArray();
    case Kind::Dictionary:
      return asDictionary() == other.asDictionary() || *asDictionary() == *other.asDictionary();
    case Kind::String:
      return *asSharedString() == *other.asSharedString();
    case Kind::Boolean:
      return asBoolean() == other.asBoolean();
    case Kind::Integer:
      return asInteger() == other.asInteger();
  }
  return false;
}

PropertyListDictionary::PropertyListDictionary(std::vector<Entry> entries) : entries_(std::move(entries)) {
  const auto byKey = [](const Entry& a, const Entry& b) { return a.first < b.first; };
  if (!std::is_sorted(entries_.begin(), entries_.end(), byKey)) {
    std::stable_sort(entries_.begin(), entries_.end(), byKey);
  }
  // Walking backwards keeps the last of several equal keys.
  const auto kept = std::unique(entries_.rbegin(), entries_.rend(),
                                [](const Entry& a, const Entry& b) { return a.first == b.first; });
  entries_.erase(entries_.begin(), kept.base());
}

const PropertyListValue* PropertyListDictionary::find(std::string_view key) const {
  const auto found =
      std::lower_bound(entries_.begin(), entries_.end(), key,
                       [](const Entry& entry, std::string_view k) { return entry.first.text() < k; });
  return found != entries_.end() && found->first.text() == key ? &found->second : nullptr;
}

std::uint64_t PropertyListDictionaryBuilder::expandedSize() const {
  std::uint64_t size = valueCost;
  for (const auto& [key, value] : entries_) size = addSaturating(size, entrySize(key, value));
  return size;
}

PropertyListDictionary PropertyListDictionaryBuilder::build() const {
  return PropertyListDictionary(std::vector<PropertyListDictionary::Entry>(entries_.begin(), entries_.end()));
}

}  // namespace kel::platform
