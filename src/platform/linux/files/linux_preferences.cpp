#include "platform/linux/files/linux_preferences.h"

#include "platform/linux/files/preferences_domain.h"

namespace kel::platform {

std::optional<PropertyListValue> LinuxPreferences::value(std::string_view domain, std::string_view key) {
  for (const auto& directory : {stateDirectory_, configurationDirectory_}) {
    const auto path = directory ? preferencesFile(*directory, domain) : std::nullopt;
    if (!path) continue;
    const DictionaryReading reading = readDictionaryFile(files_, *path, largestOwnFile, ownLimits);
    const PropertyListValue* found = reading.dictionary ? reading.dictionary->find(key) : nullptr;
    if (found) return *found;
  }
  return std::nullopt;
}

}  // namespace kel::platform
