#include "restrictions/whitelist_generator.h"

#include <ostream>
#include <string>
#include <utility>
#include <vector>

#include "common/common.h"
#include "restrictions/restriction_lists.h"

namespace kel {

namespace {

using platform::PropertyListArray;
using platform::PropertyListDictionary;
using platform::PropertyListString;
using platform::PropertyListValue;

using Entries = std::vector<KELRestrictionListEntry>;

Entries vendorServicesOf(const PropertyListValue& publication) {
  const PropertyListDictionary* dictionary = publication.asDictionary();
  const PropertyListArray* services =
      dictionary ? array_value(*dictionary, platform::publishedListKey) : nullptr;
  if (!services) return {};
  return map_array(*services, [](const PropertyListValue& value) {
    const PropertyListDictionary* service = value.asDictionary();
    return service && is_vendor_service(*service) ? restriction_entry_for_service(*service) : std::nullopt;
  });
}

void removeBlacklisted(Entries& entries, platform::SystemLog& log) {
  for (const auto& [bundleID, title] : default_blacklist) {
    const auto row =
        KELRestrictionListEntry::initWithBundleID(PropertyListString(bundleID), PropertyListString(title));
    // A row that names nothing may be a service that was renamed and now slips through.
    if (std::erase(entries, *row) > 0) continue;
    log.write("Blacklisted Service '" + std::string(bundleID) + ":" + std::string(title) +
              "' not found. Perhaps the blacklist needs to be updated?");
  }
}

void writeRestrictionsFile(platform::Platform& platform, platform::BytesView bytes, std::ostream& out) {
  const std::string name = restrictionsFileName;
  const std::optional<std::string> directory = platform.directories.temporaryDirectory();
  const std::string path = directory ? platform::joinPath(*directory, name) : name;
  const std::optional<std::string> error =
      directory ? platform.files.writePlainly(path, bytes) : "there is no safe temporary directory";
  if (error) {
    platform.log.write("Unable to write to path '" + path + "': " + *error);
  } else {
    out << "Wrote to " << path << '\n';
  }
}

}  // namespace

void generate_whitelist(platform::Platform& platform, std::ostream& out) {
  if (running_from_launcher(platform.facts)) return;
  const std::optional<PropertyListValue> publication =
      platform.preferences.value(platform::publicationDomain, platform::publicationKey);
  if (!publication) {
    out << "No services (" << platform::publicationDomain << " missing or empty in "
        << platform::publicationKey << " preferences)\n";
    return;
  }
  KELRestrictionLists lists{vendorServicesOf(*publication), {}};
  removeBlacklisted(lists.unrestricted, platform.log);
  const platform::PropertyListWriting writing =
      platform::writeBinaryPropertyList(*restriction_lists_to_plist(&lists));
  if (!writing.bytes) {
    platform.log.write("Unable to construct Services defaults: " + writing.error);
    return;
  }
  writeRestrictionsFile(platform, *writing.bytes, out);
}

}  // namespace kel
