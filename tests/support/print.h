#pragma once

#include <ostream>

#include "property_lists/property_list.h"

// How test failures show property-list values.
namespace kel::platform {

inline void PrintTo(const PropertyListValue& value, std::ostream* out) { *out << describe(value); }
inline void PrintTo(const PropertyListDictionary& value, std::ostream* out) { *out << describe(value); }

}  // namespace kel::platform
