#pragma once

#include <cstdlib>

#include "property_lists/property_list.h"

namespace kel::platform {

/// Stops the program unless a value that was read from `bytes` survives writing and describing.
inline void checkReading(const PropertyListReading& reading) {
  if (reading.value.has_value() == !reading.error.empty()) std::abort();
  if (reading.error.find('\n') != std::string::npos) std::abort();
  if (!reading.value) return;
  const PropertyListValue& value = *reading.value;

  const PropertyListLimits sameValue{512, value.expandedSize()};
  const PropertyListWriting writing = writeBinaryPropertyList(value);
  if (!writing.bytes) std::abort();
  const PropertyListReading fromBinary = readBinaryPropertyList(*writing.bytes, sameValue);
  if (!fromBinary.value || !(*fromBinary.value == value)) std::abort();
  if (writeBinaryPropertyList(*fromBinary.value).bytes != writing.bytes) std::abort();

  const std::string description = describe(value);
  const BytesView text(reinterpret_cast<const std::uint8_t*>(description.data()), description.size());
  const PropertyListReading fromText = readTextPropertyList(text, {512, 16 * description.size() + 16});
  if (!fromText.value || describe(*fromText.value) != description) std::abort();
}

}  // namespace kel::platform
