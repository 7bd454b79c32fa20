#include "entries/app_entry.h"

#include <sstream>
#include <utility>

#include "common/debug_sink.h"
#include "property_lists/unicode.h"

namespace kel {

namespace {

// How many localizations an entry remembers before it forgets that it has looked for further ones in vain:
// their names come from clients, and there may be any number of them.
constexpr std::size_t mostRemembered = 256;

namespace information_keys = platform::information_keys;
using platform::PropertyListDictionary;
using platform::PropertyListDictionaryBuilder;
using platform::PropertyListString;
using platform::PropertyListValue;

const PropertyListString bundleIDKey = "bundle_id";
const PropertyListString nameKey = "name";
const PropertyListString versionKey = "vers";
const PropertyListString servicesKey = "service_dicts";
const PropertyListString menuStringsKey = "loc_to_menu_strings";

bool isFalseMarker(const PropertyListValue& value) { return value.asBoolean() == false; }

}  // namespace

KELAppEntry::KELAppEntry(platform::Platform& platform, std::string bundlePath)
    : platform_(platform),
      bundlePath_(std::move(bundlePath)),
      app_id_(platform::md5(platform::utf16LittleEndianWithMark(bundlePath_.text()))) {}

std::shared_ptr<KELAppEntry> KELAppEntry::initWithBundlePath(platform::Platform& platform,
                                                             std::string bundlePath) {
  return std::shared_ptr<KELAppEntry>(new KELAppEntry(platform, std::move(bundlePath)));
}

std::shared_ptr<KELAppEntry> KELAppEntry::initFromCacheRepresentation(platform::Platform& platform,
                                                                      const Value& representation,
                                                                      std::string bundlePath) {
  const PropertyListDictionary* fields = representation ? representation->asDictionary() : nullptr;
  if (!fields) return nullptr;
  auto entry = initWithBundlePath(platform, std::move(bundlePath));
  entry->setBundleID(copied(fields->find(bundleIDKey)));
  entry->setBundleName(copied(fields->find(nameKey)));
  entry->setBundleVersion(copied(fields->find(versionKey)));
  entry->setInfoPlistServiceDictionaries(copied(fields->find(servicesKey)));
  entry->setLocalizationToMenuStrings(copied(fields->find(menuStringsKey)));
  return entry;
}

PropertyListDictionary KELAppEntry::cacheRepresentation() const {
  std::vector<PropertyListDictionary::Entry> fields;
  const auto add = [&](const PropertyListString& key, const Value& value) {
    if (value) fields.emplace_back(key, *value);
  };
  add(bundleIDKey, bundleID());
  add(nameKey, bundleName());
  add(versionKey, bundleVersion());
  add(servicesKey, infoPlistServiceDictionaries());
  add(menuStringsKey, localizationToMenuStrings());
  return PropertyListDictionary(std::move(fields));
}

std::string KELAppEntry::description() const {
  std::ostringstream text;
  text << "<KELAppEntry: " << static_cast<const void*>(this) << '>';
  return text.str();
}

std::unique_ptr<platform::Bundle> KELAppEntry::createBundle() const {
  return platform_.bundles.open(bundlePath());
}

void KELAppEntry::refreshCache() {
  if (servicesCacheIsValid_) return;
  const std::unique_ptr<platform::Bundle> bundle = createBundle();
  if (!bundle) {
    send_debug_line([&] { return "Unable to create a bundle for path " + bundlePath() + ", skipping it"; });
    bundleError_.clear();
    return;
  }
  if (loadFromBundle(bundle.get())) servicesCacheIsValid_ = true;
}

bool KELAppEntry::loadFromBundle(platform::Bundle* bundle) {
  send_debug_line([&] { return "Loading Services from path " + bundlePath(); });
  if (!bundle) return false;
  auto [information, error] = bundle->information();
  if (!settle(bundleError_, std::move(error))) return false;
  Value identifier = bundle->identifier();
  Value name = copied(information.find(information_keys::name));
  Value version = copied(information.find(information_keys::version));
  Value services = copied(information.find(information_keys::services));

  const bool unchanged = identifier == bundleID() && name == bundleName() && version == bundleVersion() &&
                         services == infoPlistServiceDictionaries();
  // Menu strings carry no date of their own. They are taken to have changed with the bundle's four values.
  if (!unchanged) localizationToMenuStrings_.with([](Value& strings) { strings.reset(); });
  setBundleID(std::move(identifier));
  setBundleName(std::move(name));
  setBundleVersion(std::move(version));
  setInfoPlistServiceDictionaries(std::move(services));
  return validateEntryPlistFormatOptionallyLoggingErrors(true);
}

void KELAppEntry::loadLocalizations(const std::vector<std::string>& localizations) {
  const Value current = localizationToMenuStrings();
  // A cached value of another kind holds no tables; the first lookup replaces it.
  const PropertyListDictionary* known = current ? current->asDictionary() : nullptr;
  PropertyListDictionaryBuilder tables;
  std::unique_ptr<platform::Bundle> bundle;
  bool isSettled = true;
  for (const std::string& localization : localizations) {
    const PropertyListValue* earlier = known ? known->find(localization) : nullptr;
    if (earlier) {
      if (!isFalseMarker(*earlier)) break;
      continue;
    }
    // Opened for the first localization that nothing is known of, and then for all.
    if (!bundle && !(bundle = createBundle())) break;
    Value found = lookUpMenuStrings(*bundle, localization);
    isSettled = found.has_value();
    if (!isSettled) break;
    const bool usable = !isFalseMarker(*found);
    if (usable || tables.size() + (known ? known->size() : 0) < mostRemembered) {
      tables.set(localization, *std::move(found));
    }
    if (usable) break;
  }
  // What failed earlier need not be asked for any more.
  if (isSettled) stringsError_.clear();
  if (tables.size() == 0) return;
  if (known) {
    for (const auto& [localization, table] : *known) tables.set(localization, table);
  }
  setLocalizationToMenuStrings(tables.build());
}

/// The strings table of the bundle for `localization`, or false when it has no usable one; absent when that
/// cannot be told for the moment.
KELAppEntry::Value KELAppEntry::lookUpMenuStrings(platform::Bundle& bundle, const std::string& localization) {
  if (const auto path = bundle.resourcePath("ServicesMenu", "strings", localization)) {
    platform::DictionaryReading reading = platform::readDictionaryFile(
        platform_.files, *path, platform::largestForeignFile, platform::bundleFileLimits);
    if (!settle(stringsError_, reading.isTransient ? reading.error : "")) return std::nullopt;
    if (reading.dictionary) {
      send_debug_line([&] { return "Read localization " + localization + " in app " + bundlePath(); });
      return *std::move(reading.dictionary);
    }
    send_debug_line([&] { return "Unable to read strings file " + *path; });
    platform_.log.write("Unable to read strings file " + *path + ": " + reading.error);
  }
  send_debug_line([&] { return "No entry for localization " + localization + " in app " + bundlePath(); });
  return PropertyListValue(false);
}

/// Notes why something that belongs to the entry cannot be read for the moment, or with no error that it can;
/// true for the latter. The log hears of it once, however often it is tried.
bool KELAppEntry::settle(std::string& source, std::string error) {
  if (source.empty() && !error.empty()) platform_.log.write("Cannot be read for now, trying again: " + error);
  source = std::move(error);
  return source.empty();
}

}  // namespace kel
