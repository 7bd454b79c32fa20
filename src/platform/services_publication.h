#pragma once

#include "property_lists/property_list_value.h"

namespace kel::platform {

/// The platform's list of services that applications see.
class ServicesPublication {
 public:
  virtual ~ServicesPublication() = default;

  /// Makes `publication` the published list. One call at a time. Failures go to the system log.
  virtual void publish(const PropertyListValue& publication) = 0;
};

}  // namespace kel::platform
