#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <optional>
#include <string>

#include "platform/bytes.h"
#include "platform/linux/application_information.h"

namespace kel::platform {

/// What the information dictionary of an application said when it was read.
struct RememberedApplication {
  std::optional<FileIdentity> information;  ///< of the file; absent when there was none
  std::uint32_t flags = 0;                  ///< 0 when there was none

  bool operator==(const RememberedApplication&) const = default;
};

/// By the application's path.
using RememberedApplications = std::map<std::string, RememberedApplication>;

inline constexpr std::size_t largestApplicationDatabase = 64 * 1024 * 1024;

/// The stored form, for this version of the program only; absent when it would be too large to be read back.
std::optional<Bytes> encodeApplications(const RememberedApplications& applications);

/// The stored form whose payload is `payload`, whatever that is.
Bytes sealApplicationDatabase(BytesView payload);

/// All of a stored form, or one line that says why none of it can be used. Needs at most a few times the
/// memory of `bytes`.
struct ApplicationDatabaseReading {
  std::optional<RememberedApplications> applications;
  std::string error;
};
ApplicationDatabaseReading decodeApplications(BytesView bytes);

}  // namespace kel::platform
