#pragma once

#include <optional>
#include <string_view>

#include "property_lists/property_list_value.h"

namespace kel::platform {

/// The preferences domain that holds the published services, and the key of the publication in it.
inline constexpr std::string_view publicationDomain = "com.orvex.ServicesMenu.Services";
inline constexpr std::string_view publicationKey = "QVServices";

/// The platform's list of services that applications see.
class ServicesPublication {
 public:
  virtual ~ServicesPublication() = default;

  /// Makes `publication` the published list. One call at a time. Failures go to the system log.
  virtual void publish(const PropertyListValue& publication) = 0;
};

/// Application preferences as the current user sees them.
class Preferences {
 public:
  virtual ~Preferences() = default;

  /// The value of `key` in `domain`, read anew; absent when there is none.
  virtual std::optional<PropertyListValue> value(std::string_view domain, std::string_view key) = 0;
};

}  // namespace kel::platform
