#pragma once

#include <random>

#include "platform/property_list_value.h"

namespace kel::platform {

/// A value of any kind, containers nesting at most `depth` levels. The same state of `random` gives the same
/// value. Strings and numbers repeat now and then.
PropertyListValue randomValue(std::mt19937& random, int depth);

/// An equal value that shares no part with `value`, its dictionaries built in reverse order.
PropertyListValue deepCopy(const PropertyListValue& value);

}  // namespace kel::platform
