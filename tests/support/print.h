#pragma once

#include <iosfwd>

#include "platform/property_list_value.h"

// How test failures show property-list values.
namespace kel::platform {

void PrintTo(const PropertyListValue& value, std::ostream* out);
void PrintTo(const PropertyListDictionary& dictionary, std::ostream* out);

}  // namespace kel::platform
