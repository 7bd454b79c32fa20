#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace kel::platform {

/// The file of a preferences domain below a state or configuration directory; absent for a domain whose name
/// is no plain file name.
std::optional<std::string> preferencesFile(const std::string& directory, std::string_view domain);

}  // namespace kel::platform
