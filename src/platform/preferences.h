#pragma once

#include <optional>
#include <string_view>

#include "property_lists/property_list_value.h"

namespace kel::platform {

/// Application preferences as the current user sees them.
class Preferences {
 public:
  virtual ~Preferences() = default;

  /// The value of `key` in `domain`, read anew; absent when there is none.
  virtual std::optional<PropertyListValue> value(std::string_view domain, std::string_view key) = 0;
};

}  // namespace kel::platform
