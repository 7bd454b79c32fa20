#include "platform/linux/files/linux_services_publication.h"

#include "platform/linux/files/preferences_domain.h"

namespace kel::platform {

void LinuxServicesPublication::publish(const PropertyListValue& publication) {
  const auto path = stateDirectory_ ? preferencesFile(*stateDirectory_, publicationDomain) : std::nullopt;
  if (!path) return log_.write("Cannot publish services: there is no state directory");
  PropertyListDictionaryBuilder domain;
  if (files_.exists(*path)) {
    const DictionaryReading old = readDictionaryFile(files_, *path, largestOwnFile, ownLimits);
    if (old.dictionary) {
      domain = PropertyListDictionaryBuilder(*old.dictionary);
    } else {
      log_.write("Replacing the unreadable preferences file " + *path + ": " + old.error);
    }
  }
  domain.set(publicationKey, publication);
  const PropertyListWriting writing = writeBinaryPropertyList(PropertyListValue(domain.build()));
  const auto error = writing.bytes ? files_.writeAtomically(*path, *writing.bytes) : writing.error;
  if (error) log_.write("Cannot publish services: " + *error);
}

}  // namespace kel::platform
