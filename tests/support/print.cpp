#include "support/print.h"

#include <ostream>

#include "platform/property_list.h"

namespace kel::platform {

void PrintTo(const PropertyListValue& value, std::ostream* out) { *out << describe(value); }

void PrintTo(const PropertyListDictionary& dictionary, std::ostream* out) {
  *out << describe(PropertyListValue(dictionary));
}

}  // namespace kel::platform
