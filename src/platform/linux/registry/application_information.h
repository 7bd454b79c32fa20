#pragma once

#include <cstdint>
#include <string>

#include "platform/linux/journal/entry_record.h"
#include "property_lists/bytes.h"

namespace kel::platform {

/// The status (see `EntryStatus`) of an application's information dictionary, links followed.
struct InformationStatus {
  EntryStatus status;  ///< of kind unknown, and else empty, when there is no such file or `isKnown` is false
  bool isKnown = false;      ///< the kernel answered, be it that there is no such file
  bool isTransient = false;  ///< it did not, for a reason that may pass by itself
  bool isLink = false;       ///< the dictionary lies somewhere else

  bool exists() const { return status.kind != EntryKind::Unknown; }
};
InformationStatus informationStatus(const std::string& application);

/// The information flags that a dictionary of these contents sets; none when it is malformed.
std::uint32_t informationFlags(BytesView contents);

/// Where an application's information dictionary is.
std::string informationPath(const std::string& application);

}  // namespace kel::platform
