#include "restrictions/restriction_lists.h"

#include <set>
#include <string>
#include <string_view>
#include <unordered_map>
#include <utility>

#include "common/service_keys.h"

namespace kel {

namespace {

using platform::PropertyListArray;
using platform::PropertyListDictionary;
using platform::PropertyListDictionaryBuilder;
using platform::PropertyListString;
using platform::PropertyListValue;

/// A set of entries, hashed by title. The identifiers under one title are ordered, so that a list with many
/// rows of one title costs no more than another.
class EntrySet {
 public:
  explicit EntrySet(const std::vector<KELRestrictionListEntry>& entries) {
    for (const KELRestrictionListEntry& entry : entries) {
      identifiers_[entry.title().text()].insert(entry.bundleID().text());
    }
  }

  bool contains(const KELRestrictionListEntry& entry) const {
    const auto found = identifiers_.find(entry.title().text());
    return found != identifiers_.end() && found->second.contains(entry.bundleID().text());
  }

 private:
  // Views into the entries, which outlive the set.
  std::unordered_map<std::string_view, std::set<std::string_view>> identifiers_;
};

constexpr std::string_view unrestrictedKey = "QVUnrestricted";
constexpr std::string_view restrictedKey = "QVRestricted";

PropertyListArray rowsUnder(const PropertyListDictionary& plist, std::string_view key) {
  return copied(array_value(plist, key)).value_or(PropertyListArray());
}

}  // namespace

platform::DictionaryReading load_restrictions_file(platform::Platform& platform) {
  const std::vector<std::string> libraries = platform.directories.systemLibraryDirectories();
  if (libraries.empty()) return {};
  const std::string path =
      platform::joinPath(platform::joinPath(libraries.back(), "CoreAgents"), restrictionsFileName);
  platform::DictionaryReading reading =
      platform::readDictionaryFile(platform.files, path, platform::largestForeignFile);
  if (!reading.dictionary && !reading.isTransient && platform.files.exists(path)) {
    platform.log.write("Cannot read the restrictions file " + path + ": " + reading.error);
  }
  return reading;
}

std::shared_ptr<const KELRestrictionLists> restriction_lists_from_plist(
    const std::optional<PropertyListDictionary>& plist) {
  if (!plist) return nullptr;
  const RestrictionListsOf<PropertyListValue> rows{rowsUnder(*plist, unrestrictedKey),
                                                   rowsUnder(*plist, restrictedKey)};
  return std::make_shared<const KELRestrictionLists>(
      transform_restriction_lists(rows, &KELRestrictionListEntry::initWithDictionaryRepresentation));
}

std::optional<PropertyListDictionary> restriction_lists_to_plist(const KELRestrictionLists* lists) {
  if (!lists) return std::nullopt;
  auto rows = transform_restriction_lists(*lists, [](const KELRestrictionListEntry& entry) {
    return std::optional<PropertyListValue>(entry.dictionaryRepresentation());
  });
  return PropertyListDictionary({{unrestrictedKey, PropertyListArray(std::move(rows.unrestricted))},
                                 {restrictedKey, PropertyListArray(std::move(rows.restricted))}});
}

void apply_restriction_lists(std::vector<PropertyListDictionaryBuilder>& services,
                             const KELRestrictionLists* lists) {
  const KELRestrictionLists none;
  const EntrySet unrestricted((lists ? *lists : none).unrestricted);
  const EntrySet restricted((lists ? *lists : none).restricted);
  for (PropertyListDictionaryBuilder& service : services) {
    // What the bundle declares holds, even when it is false.
    if (service.find(service_keys::QVRestricted)) continue;
    const std::optional<KELRestrictionListEntry> entry = restriction_entry_for_service(service);
    if (!entry) continue;
    if (restricted.contains(*entry) || (is_vendor_service(service) && !unrestricted.contains(*entry))) {
      service.set(service_keys::QVRestricted, true);
    }
  }
}

bool is_vendor_service(const ServiceView& service) {
  const std::string* identifier = string_value(service, service_keys::QVBundleIdentifier);
  return identifier && identifier->starts_with("com.orvex.");
}

std::optional<KELRestrictionListEntry> restriction_entry_for_service(const ServiceView& service) {
  const PropertyListDictionary* titles = dictionary_value(service, service_keys::QVMenuItem);
  if (!titles) return std::nullopt;
  const PropertyListString* title = shared_string_value(*titles, service_keys::defaultTitle);
  if (!title) title = shared_string_value(*titles, "English");
  return KELRestrictionListEntry::initWithBundleID(
      copied(shared_string_value(service, service_keys::QVBundleIdentifier)), copied(title));
}

}  // namespace kel
