#pragma once

// What the property-list readers share. No other code includes this header.

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "property_lists/property_list.h"

namespace kel::platform {

/// What is wrong with the input, thrown inside a reader and caught by its public function. `position` is a
/// byte offset into the bytes or the decoded text.
struct MalformedPropertyList {
  std::size_t position;
  std::string what;
};

/// How deep a value under construction may still nest and how much it may still expand.
class PropertyListBudget {
 public:
  PropertyListBudget(const PropertyListLimits& limits, std::size_t inputSize);

  // These throw when the input asks for more than its limits allow.
  void checkDepth(std::size_t levels, std::size_t position) const {
    if (levels > depth_) refuseDepth(position);
  }
  void checkSize(std::uint64_t expandedSize, std::size_t position) const {
    if (expandedSize > expandedSize_) refuseSize(position);
  }

  /// Counts `size` more bytes of the value's expanded size.
  void spend(std::uint64_t size, std::size_t position) {
    spent_ += size;
    checkSize(spent_, position);
  }

  /// The cost of each value, whatever its kind, in `PropertyListValue::expandedSize`.
  static constexpr std::uint64_t valueCost = 8;

 private:
  [[noreturn]] void refuseDepth(std::size_t position) const;
  [[noreturn]] void refuseSize(std::size_t position) const;

  std::uint32_t depth_;
  std::uint64_t expandedSize_;
  std::uint64_t spent_ = 0;
};

/// Builds a value from its parts in the order in which an XML or text file names them, without recursion.
/// The operations throw when a limit is exceeded.
class PropertyListAssembly {
 public:
  PropertyListAssembly(const PropertyListLimits& limits, std::size_t inputSize)
      : budget_(limits, inputSize) {}

  void openArray(std::size_t position) { open(false, position); }
  void openDictionary(std::size_t position) { open(true, position); }

  /// The key of the value that comes next. Only in a dictionary that awaits a key.
  void setKey(PropertyListString key, std::size_t position);

  /// A value that is no container.
  void add(PropertyListValue value, std::size_t position);

  /// Ends the innermost container. Not while a dictionary awaits a value.
  void close();

  std::size_t depth() const { return open_.size(); }
  bool inDictionary() const { return !open_.empty() && open_.back().isDictionary; }
  bool awaitsValue() const {
    return inDictionary() && keys_.size() - open_.back().firstKey > countOfValues();
  }
  bool isComplete() const { return result_.has_value(); }
  PropertyListValue result() { return std::move(*result_); }

 private:
  struct Container {
    bool isDictionary;
    std::size_t firstKey;
    std::size_t firstValue;
  };

  void open(bool isDictionary, std::size_t position);
  void place(PropertyListValue value);
  std::size_t countOfValues() const { return values_.size() - open_.back().firstValue; }

  PropertyListBudget budget_;
  std::vector<Container> open_;
  // The parts of all open containers, the innermost one's last.
  std::vector<PropertyListString> keys_;
  std::vector<PropertyListValue> values_;
  std::optional<PropertyListValue> result_;
};

/// Moves the last `values.size() - firstValue` values, or pairs, out of the stacks into a container.
PropertyListArray takeArray(std::vector<PropertyListValue>& values, std::size_t firstValue);
PropertyListDictionary takeDictionary(std::vector<PropertyListString>& keys, std::size_t firstKey,
                                      std::vector<PropertyListValue>& values, std::size_t firstValue);

/// Shares strings that repeat within a file. Forgets some, so that a look-up costs no more than a copy.
class SharedStrings {
 public:
  PropertyListString get(std::string_view text);

 private:
  std::array<std::optional<PropertyListString>, 256> slots_;
};

/// The characters of a file as UTF-8: the file's own bytes, or `converted` when they were UTF-16.
struct DecodedText {
  std::string converted;
  std::string_view text;
  std::string error;
};

/// Takes a byte-order mark off and checks the rest. `bytes` outlive `decoded`.
void decodeText(BytesView bytes, DecodedText& decoded);

/// The readers behind `readXMLPropertyList` and `readTextPropertyList`; `text` is well-formed UTF-8.
PropertyListReading readXMLText(std::string_view text, const PropertyListLimits& limits);
PropertyListReading readPlainText(std::string_view text, const PropertyListLimits& limits);

/// "line 3, column 5: what", counted from 1, columns in characters.
PropertyListReading malformedAt(std::string_view text, const MalformedPropertyList& malformed);

bool isASCII(std::string_view text);

constexpr bool isBlank(char c) {
  return c == ' ' || c == '\n' || c == '\t' || c == '\r' || c == '\v' || c == '\f';
}

/// True for the characters of strings that need no quotes in the text encoding.
constexpr bool isBare(char c) {
  return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '.' || c == '_' ||
         c == '/' || c == '-' || c == ':' || c == '$';
}

/// The value of a hexadecimal digit, or -1.
constexpr int hexadecimalDigit(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

}  // namespace kel::platform
