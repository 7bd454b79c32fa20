#include "platform/linux/registry/application_information.h"

#include <cerrno>
#include <utility>

#include "platform/application_registry.h"
#include "platform/bundles.h"
#include "platform/file_system.h"
#include "platform/linux/files/files.h"
#include "platform/linux/journal/entry_look.h"

namespace kel::platform {

InformationStatus informationStatus(const std::string& application) {
  const EntryLook look = lookAtEntry(informationPath(application));
  InformationStatus result{look.status, true, false, look.isLink()};
  if (result.exists()) return result;
  const std::uint64_t error = std::exchange(result.status, {}).size;
  // Other errors say that there may be one which cannot be seen now: permissions, a disk, a server far away.
  result.isKnown = error == ENOENT || error == ENOTDIR || error == ELOOP;
  result.isTransient = platform::isTransient(static_cast<int>(error));
  return result;
}

std::uint32_t informationFlags(BytesView contents) {
  const PropertyListReading reading = readPropertyList(contents, bundleFileLimits);
  const PropertyListDictionary* dictionary = reading.value ? reading.value->asDictionary() : nullptr;
  const PropertyListArray* services =
      dictionary ? array_value(*dictionary, information_keys::services) : nullptr;
  return services && !services->empty() ? ApplicationRegistry::providesServices : 0;
}

std::string informationPath(const std::string& application) { return joinPath(application, "Info.plist"); }

}  // namespace kel::platform
