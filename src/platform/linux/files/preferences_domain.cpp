#include "platform/linux/files/preferences_domain.h"

#include "platform/file_system.h"

namespace kel::platform {

std::optional<std::string> preferencesFile(const std::string& directory, std::string_view domain) {
  using namespace std::string_view_literals;
  // The name of a domain comes from callers and must stay one component of the path.
  constexpr std::size_t longestDomain = 200;
  if (domain.empty() || domain.size() > longestDomain || domain.front() == '.' ||
      domain.find_first_of("/\0"sv) != std::string_view::npos) {
    return std::nullopt;
  }
  return joinPath(directory, "kel/preferences/" + std::string(domain) + ".plist");
}

}  // namespace kel::platform
