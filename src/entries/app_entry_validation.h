#pragma once

#include <cstddef>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "property_lists/property_list_value.h"

namespace kel {

/// The kinds of value that service dictionaries are tested for; a boolean is a number.
enum class ServiceValueType { String, Array, Dictionary, Number };

/// The problems found in one bundle. A hostile one can have millions: the first 200 are kept, the others
/// counted.
class ValidationErrors {
 public:
  static constexpr std::size_t most = 200;

  template <typename Format>
  void add(Format&& format) {
    if (messages_.size() < most) {
      messages_.push_back(format());
    } else {
      ++notKept_;
    }
  }

  bool empty() const { return messages_.empty(); }

  /// The messages after `heading`, each on its own line behind a tab.
  std::string report(std::string heading) const;

 private:
  std::vector<std::string> messages_;
  std::size_t notKept_ = 0;
};

/// Keys in lower case.
using ServiceKeyTable = std::span<const std::string_view>;

// The tests of single values. Each is true when `value` passes; a null `value` is absent and always does.
// Failures are added to `errors` unless it is null; `key` is what they name.

/// `element` words the failure as one of a container's contents.
bool validate_value_type(std::string_view key, const platform::PropertyListValue* value,
                         ServiceValueType expected, bool element, ValidationErrors* errors);

bool validate_string(std::string_view key, const platform::PropertyListValue* value,
                     ValidationErrors* errors);

/// An array of strings; only its first element that is none is reported.
bool validate_string_array(std::string_view key, const platform::PropertyListValue* value,
                           ValidationErrors* errors);

/// A context dictionary or, unless `nested`, an array of them.
bool validate_context(std::string_view key, const platform::PropertyListValue* value, bool nested,
                      ValidationErrors* errors);

/// One declared service: every key that the system knows holds a value of the right kind.
bool validate_service_dictionary(const platform::PropertyListDictionary& service, ValidationErrors* errors);

/// True when `key` equals one of the table's keys without regard to letter case.
bool key_in_list(std::string_view key, ServiceKeyTable table);

}  // namespace kel
