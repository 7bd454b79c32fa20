#include "platform/bundles.h"

namespace kel::platform {

std::optional<PropertyListValue> bundleIdentifier(const PropertyListDictionary& informationDictionary) {
  const PropertyListValue* identifier = informationDictionary.find(information_keys::identifier);
  return identifier ? std::optional(*identifier) : std::nullopt;
}

bool canNameLocalization(std::string_view name) {
  using namespace std::string_view_literals;
  return !name.empty() && name.size() <= longestLocalizationName && name.front() != '.' &&
         name.find_first_of("/\0"sv) == std::string_view::npos;
}

std::optional<std::string> localizedResourceName(std::string_view name, std::string_view type,
                                                 std::string_view localization) {
  if (!canNameLocalization(localization)) return std::nullopt;
  return std::string("Resources/").append(localization).append("/").append(name).append(".").append(type);
}

}  // namespace kel::platform
