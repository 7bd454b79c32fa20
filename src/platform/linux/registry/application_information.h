#pragma once

#include <cstdint>
#include <string>

#include "platform/linux/journal/entry_record.h"
#include "property_lists/bytes.h"

namespace kel::platform {

/// What can be told about an application's information dictionary without opening it. Links are followed.
struct InformationStatus {
  EntryStatus status;    ///< without anything when there is no such file, or when it cannot be told
  bool isKnown = false;  ///< it can be told
  bool isLink = false;   ///< the dictionary lies somewhere else

  bool exists() const { return status.kind != EntryKind::Unknown; }
};
InformationStatus informationStatus(const std::string& application);

/// The information flags that a dictionary of these contents sets; none when it is malformed.
std::uint32_t informationFlags(BytesView contents);

/// Where an application's information dictionary is.
std::string informationPath(const std::string& application);

}  // namespace kel::platform
