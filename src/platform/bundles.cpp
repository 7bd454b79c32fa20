#include "platform/bundles.h"

namespace kel::platform {

std::optional<PropertyListValue> bundleIdentifier(const PropertyListDictionary& informationDictionary) {
  const PropertyListValue* identifier = informationDictionary.find(information_keys::identifier);
  return identifier ? std::optional(*identifier) : std::nullopt;
}

std::optional<std::string> localizedResourceName(std::string_view name, std::string_view type,
                                                 std::string_view localization) {
  using namespace std::string_view_literals;
  if (localization.empty() || localization.size() > longestLocalizationName || localization.front() == '.' ||
      localization.find_first_of("/\0"sv) != std::string_view::npos) {
    return std::nullopt;
  }
  return std::string("Resources/").append(localization).append("/").append(name).append(".").append(type);
}

}  // namespace kel::platform
