#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <string_view>

#include "platform/linux/journal/entry_record.h"
#include "property_lists/bytes.h"

namespace kel::platform {

/// What the information dictionary of an application said when it was read.
struct RememberedApplication {
  EntryStatus information;  ///< of the file; unknown when there was none
  std::uint32_t flags = 0;  ///< 0 when there was none

  bool operator==(const RememberedApplication&) const = default;
};

/// By the application's path.
using RememberedApplications = std::map<std::string, RememberedApplication>;

inline constexpr std::size_t largestApplicationDatabase = 64 * 1024 * 1024;
inline constexpr std::string_view applicationDatabaseFormat = "kel applications 3 of " KEL_VERSION;

/// The stored form, for this version of the program only; absent when it would be too large to be read back.
std::optional<Bytes> encodeApplications(const RememberedApplications& applications);

/// All of a stored form; absent, whatever is wrong with it. Needs at most a few times the memory of `file`.
std::optional<RememberedApplications> decodeApplications(BytesView file);

}  // namespace kel::platform
