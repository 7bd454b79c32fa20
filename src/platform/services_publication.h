#pragma once

#include "property_lists/property_list_value.h"

namespace kel::platform {

/// The preferences domain that holds the published services, the key of the publication in it, and the key of
/// the list in the publication.
inline constexpr std::string_view publicationDomain = "com.orvex.ServicesMenu.Services";
inline constexpr std::string_view publicationKey = "QVServices";
inline constexpr std::string_view publishedListKey = "KTVendedServices";

/// The platform's list of services that applications see.
class ServicesPublication {
 public:
  virtual ~ServicesPublication() = default;

  /// Makes `publication` the published list. One call at a time. Failures go to the system log.
  virtual void publish(const PropertyListValue& publication) = 0;
};

}  // namespace kel::platform
