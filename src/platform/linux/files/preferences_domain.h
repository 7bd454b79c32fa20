#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace kel::platform {

/// The preferences domain that holds the published services, and the key of the list in it.
inline constexpr std::string_view publicationDomain = "com.orvex.ServicesMenu.Services";
inline constexpr std::string_view publicationKey = "QVServices";

/// The file of a preferences domain below a state or configuration directory; absent for a domain whose name
/// is no plain file name.
std::optional<std::string> preferencesFile(const std::string& directory, std::string_view domain);

}  // namespace kel::platform
