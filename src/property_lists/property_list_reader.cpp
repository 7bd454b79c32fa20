// From bytes to values: what the XML and the text encoding share.
//
// The bytes are decoded first. A mark says UTF-16, which is converted; all else must be UTF-8 and is used in
// place. From then on there is only well-formed UTF-8, and positions in it become line and column when
// something is wrong. A reader names the parts of the value in the order of the file, and the assembly puts
// them together: `open_` is the stack of containers that were begun, and the keys and values of all of them
// lie on two common stacks, the innermost one's last. Closing a container takes its own off these and places
// the result in the container around it.
//
// The keys of one service are those of the next thousand. Short strings are therefore shared through a table
// of fixed size, where a new one takes the place of another: a table that grew would have to be defended
// against keys chosen to collide, and to have forgotten a string costs no more than its copy.
//
// Never happens: recursion, because a foreign file may nest as deeply as it is long; a part that is kept
// before its size was charged to the budget; a position that points into anything but the decoded text.

#include <algorithm>
#include <cstring>

#include "property_lists/property_list.h"
#include "property_lists/property_list_parsing.h"
#include "property_lists/unicode.h"

namespace kel::platform {

namespace {

std::string_view characters(BytesView bytes) {
  return {reinterpret_cast<const char*>(bytes.data()), bytes.size()};
}

/// The position of the first byte of `text` that is no well-formed UTF-8.
std::size_t firstIllFormed(std::string_view text) {
  for (std::size_t position = 0; position < text.size();) {
    const std::size_t start = position;
    if (nextCharacter(text, position) == 0xFFFD && position == start + 1) return start;
  }
  return text.size();
}

/// True when `text`, which begins with "<", is no data of the text encoding: no XML name that a property list
/// uses consists of hexadecimal digits only.
bool beginsMarkup(std::string_view text) {
  text.remove_prefix(1);
  if (text.starts_with('!') || text.starts_with('?')) return true;
  const auto nameEnd = std::find_if(text.begin(), text.end(), [](char c) { return hexadecimalDigit(c) < 0; });
  const bool startsLikeName = !text.empty() && !(text[0] >= '0' && text[0] <= '9');
  return startsLikeName && nameEnd != text.end() && !isBlank(*nameEnd) && *nameEnd != '>';
}

}  // namespace

PropertyListBudget::PropertyListBudget(const PropertyListLimits& limits, std::size_t inputSize)
    : depth_(limits.depth), expandedSize_(limits.expandedSize.value_or((64U << 20) + 16 * inputSize)) {}

void PropertyListBudget::refuseDepth(std::size_t position) const {
  throw MalformedPropertyList{position, "nested deeper than " + std::to_string(depth_) + " levels"};
}

void PropertyListBudget::refuseSize(std::size_t position) const {
  throw MalformedPropertyList{position,
                              "the value expands to more than " + std::to_string(expandedSize_) + " bytes"};
}

void PropertyListAssembly::open(bool isDictionary, std::size_t position) {
  budget_.checkDepth(open_.size() + 1, position);
  budget_.spend(PropertyListBudget::valueCost, position);
  open_.push_back({isDictionary, keys_.size(), values_.size()});
}

void PropertyListAssembly::setKey(PropertyListString key, std::size_t position) {
  budget_.spend(key.text().size() + PropertyListBudget::valueCost, position);
  keys_.push_back(std::move(key));
}

void PropertyListAssembly::add(PropertyListValue value, std::size_t position) {
  budget_.spend(value.expandedSize(), position);
  place(std::move(value));
}

void PropertyListAssembly::close() {
  const Container closed = open_.back();
  open_.pop_back();
  if (closed.isDictionary) {
    place(takeDictionary(keys_, closed.firstKey, values_, closed.firstValue));
  } else {
    place(takeArray(values_, closed.firstValue));
  }
}

void PropertyListAssembly::place(PropertyListValue value) {
  if (open_.empty()) {
    result_ = std::move(value);
  } else {
    values_.push_back(std::move(value));
  }
}

PropertyListArray takeArray(std::vector<PropertyListValue>& values, std::size_t firstValue) {
  const auto first = values.begin() + static_cast<std::ptrdiff_t>(firstValue);
  PropertyListArray array(std::make_move_iterator(first), std::make_move_iterator(values.end()));
  values.erase(first, values.end());
  return array;
}

PropertyListDictionary takeDictionary(std::vector<PropertyListString>& keys, std::size_t firstKey,
                                      std::vector<PropertyListValue>& values, std::size_t firstValue) {
  std::vector<PropertyListDictionary::Entry> entries;
  entries.reserve(values.size() - firstValue);
  for (std::size_t i = 0; firstValue + i < values.size(); ++i) {
    entries.emplace_back(std::move(keys[firstKey + i]), std::move(values[firstValue + i]));
  }
  keys.erase(keys.begin() + static_cast<std::ptrdiff_t>(firstKey), keys.end());
  values.erase(values.begin() + static_cast<std::ptrdiff_t>(firstValue), values.end());
  return PropertyListDictionary(std::move(entries));
}

PropertyListString SharedStrings::get(std::string_view text) {
  constexpr std::size_t longestShared = 64;
  if (text.size() > longestShared) return text;
  // Both ends of the text decide on its slot: keys have long common beginnings.
  std::uint64_t ends[2] = {};
  const std::size_t taken = std::min(text.size(), sizeof ends[0]);
  std::memcpy(&ends[0], text.data(), taken);
  std::memcpy(&ends[1], text.data() + text.size() - taken, taken);
  const std::uint64_t hash =
      (ends[0] * 0x9E3779B97F4A7C15U ^ ends[1]) * 0xD6E8FEB86659FD93U + text.size() * 0xA0761D6478BD642FU;
  auto& slot = slots_[hash >> 56];
  if (!slot || slot->text() != text) slot.emplace(text);
  return *slot;
}

void decodeText(BytesView bytes, DecodedText& decoded) {
  const std::string_view text = characters(bytes);
  const bool bigEndian = text.starts_with("\xFE\xFF");
  if (bigEndian || text.starts_with("\xFF\xFE")) {
    auto converted = utf8FromUTF16(bytes.subspan(2), bigEndian);
    if (!converted) {
      decoded.error = "the byte-order mark says UTF-16, but a surrogate stands alone or half a unit is left";
      return;
    }
    decoded.converted = std::move(*converted);
    decoded.text = decoded.converted;
    return;
  }
  decoded.text = text.substr(text.starts_with("\xEF\xBB\xBF") ? 3 : 0);
  if (!isValidUTF8(decoded.text)) {
    decoded.error = malformedAt(decoded.text, {firstIllFormed(decoded.text), "ill-formed UTF-8"}).error;
  }
}

PropertyListReading malformedAt(std::string_view text, const MalformedPropertyList& malformed) {
  const std::string_view before = text.substr(0, malformed.position);
  const auto line = std::count(before.begin(), before.end(), '\n') + 1;
  const std::string_view inLine = before.substr(before.rfind('\n') + 1);
  const auto column =
      std::count_if(inLine.begin(), inLine.end(), [](char c) { return (c & 0xC0) != 0x80; }) + 1;
  return {std::nullopt,
          "line " + std::to_string(line) + ", column " + std::to_string(column) + ": " + malformed.what};
}

bool isASCII(std::string_view text) {
  // Eight bytes at a time: every string that is read or written passes here.
  std::uint64_t seen = 0;
  for (; text.size() >= sizeof seen; text.remove_prefix(sizeof seen)) {
    std::uint64_t block;
    std::memcpy(&block, text.data(), sizeof block);
    seen |= block;
  }
  for (const char c : text) seen |= static_cast<unsigned char>(c);
  return (seen & 0x8080808080808080U) == 0;
}

PropertyListReading readPropertyList(BytesView bytes, const PropertyListLimits& limits) {
  if (characters(bytes).starts_with("bplist00")) return readBinaryPropertyList(bytes, limits);
  DecodedText decoded;
  decodeText(bytes, decoded);
  if (!decoded.error.empty()) return {std::nullopt, decoded.error};
  const auto first = std::find_if_not(decoded.text.begin(), decoded.text.end(), isBlank);
  const std::string_view content =
      decoded.text.substr(static_cast<std::size_t>(first - decoded.text.begin()));
  if (content.starts_with('<') && beginsMarkup(content)) return readXMLText(decoded.text, limits);
  return readPlainText(decoded.text, limits);
}

PropertyListReading readXMLPropertyList(BytesView bytes, const PropertyListLimits& limits) {
  DecodedText decoded;
  decodeText(bytes, decoded);
  return decoded.error.empty() ? readXMLText(decoded.text, limits)
                               : PropertyListReading{std::nullopt, decoded.error};
}

PropertyListReading readTextPropertyList(BytesView bytes, const PropertyListLimits& limits) {
  DecodedText decoded;
  decodeText(bytes, decoded);
  return decoded.error.empty() ? readPlainText(decoded.text, limits)
                               : PropertyListReading{std::nullopt, decoded.error};
}

}  // namespace kel::platform
