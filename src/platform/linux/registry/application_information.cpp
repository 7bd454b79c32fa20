#include "platform/linux/registry/application_information.h"

#include <cerrno>
#include <fcntl.h>
#include <utility>

#include "platform/application_registry.h"
#include "platform/bundles.h"
#include "platform/file_system.h"
#include "platform/linux/files/files.h"
#include "platform/linux/journal/entry_look.h"

namespace kel::platform {

InformationStatus informationStatus(const std::string& application) {
  const EntryRecord record = lookAtEntry(AT_FDCWD, informationPath(application).c_str());
  InformationStatus result{record.isLink() ? record.target : record.status, true, false, record.isLink()};
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
