// What a restarted server still knows.
//
// The file holds what the last update learnt and the position in the journal from before that update. A
// server loads it when it is first asked for anything and answers from it at once; what changed since that
// position is found by the next update. Everything in it is therefore taken for valid: locators need no
// listing, entries no bundle. A file of another build version, of the system's or of this program's, is no
// file. One from an earlier boot or session still serves the first answer; the server then has everything
// looked at.
//
// Reading is lenient in the small: one value of the wrong kind counts as absent, one odd element is passed
// over, and nothing is validated. What can be made of a damaged entry is decided where it is used.
//
// Writing turns the store's contents into bytes on the calling queue and leaves the disk to `writeQueue_`,
// with a transaction so that the launcher lets it finish. Files so appear in the order of the updates, and a
// flush, which waits for that queue, deletes the last of them.
//
// Never happens: a file half written, because a complete one takes its place; a write that overtakes a flush;
// a cache that keeps a change from being seen, because position and contents are written together.

#include <utility>

#include "common/common.h"
#include "datastore/boot_session.h"
#include "datastore/data_store.h"

namespace kel {

using platform::PropertyListArray;
using platform::PropertyListDictionary;
using platform::PropertyListDictionaryBuilder;
using platform::PropertyListValue;

namespace {

constexpr const char* lastEventIDKey = "QVServicesLastEventID";
constexpr const char* explicitDirectoryCacheKey = "QVServicesExplicitDirectoryCache";
constexpr const char* servicesCacheKey = "ServicesCache";
constexpr const char* restrictionListsKey = "QVServicesRestrictionLists";
constexpr const char* registryPathsKey = "QVServicesARPaths";
constexpr const char* sessionIDKey = "QVServicesSessionID";
constexpr const char* buildVersionKey = "QVServicesBuildVersion";

/// The strings of an array; elements of other kinds are no paths and are passed over.
std::vector<std::string> stringElements(const PropertyListArray& array) {
  return map_array(array, [](const PropertyListValue& element) { return element.asString(); });
}

PropertyListValue arrayOfStrings(const auto& strings) {
  return PropertyListArray(strings.begin(), strings.end());
}

}  // namespace

std::unique_ptr<KELDataStore> KELDataStore::initWithSystemServices(platform::Platform& platform) {
  return std::unique_ptr<KELDataStore>(new KELDataStore(platform));
}

std::optional<std::string> KELDataStore::cacheFilePath() const {
  return cache_file_path(platform_.directories);
}

const std::string& KELDataStore::operatingSystemBuildVersion() const {
  return platform_.constants.buildVersion.get([this] { return platform_.facts.buildVersion(); });
}

bool KELDataStore::validateCacheDictionaryVersion(const PropertyListDictionary& dictionary) const {
  const std::string* version = string_value(dictionary, buildVersionKey);
  return version && *version == operatingSystemBuildVersion();
}

std::optional<PropertyListDictionary> KELDataStore::cacheDictionary() const {
  const std::optional<std::string> path = cacheFilePath();
  if (!path) return std::nullopt;
  platform::DictionaryReading cache =
      platform::readDictionaryFile(platform_.files, *path, platform::largestOwnFile, platform::ownLimits);
  if (!cache.dictionary) {
    send_debug_line([&] {
      return "Cache at " + *path + " came back nil (file does" +
             (platform_.files.exists(*path) ? "" : " NOT") + " exist)";
    });
    return std::nullopt;
  }
  if (!validateCacheDictionaryVersion(*cache.dictionary)) {
    send_debug_line([] { return "Ignoring cache because it has the wrong version"; });
    return std::nullopt;
  }
  send_debug_line([] { return "Cache read OK"; });
  return std::move(cache.dictionary);
}

void KELDataStore::loadCache() {
  send_debug_line([&] { return "Loading cache from " + cacheFilePath().value_or("(null)"); });
  const PropertyListDictionary cache = cacheDictionary().value_or(PropertyListDictionary());
  send_debug_line([&] { return "Cache contains " + std::to_string(cache.size()) + " keys"; });

  if (const auto eventID = typed_value<&PropertyListValue::asUnsigned64>(cache, lastEventIDKey)) {
    eventStreamID_ = *eventID;
    send_debug_line([&] { return "EventStreamID was " + std::to_string(eventStreamID_); });
  }

  cacheSessionID_ = platform::copied(string_value(cache, sessionIDKey));

  const PropertyListDictionary* lists = dictionary_value(cache, restrictionListsKey);
  restrictionLists_ = restriction_lists_from_plist(lists ? std::optional(*lists)
                                                         : load_restrictions_file(platform_).dictionary);

  const PropertyListArray* registryPaths = array_value(cache, registryPathsKey);
  if (registryPaths) {
    pathsFromAR_ = std::make_shared<const std::vector<std::string>>(stringElements(*registryPaths));
  }
  send_debug_line([&] {
    return std::to_string(registryPaths ? registryPaths->size() : 0) + " path(s) from AppRegistry";
  });

  const PropertyListDictionary none;
  const PropertyListDictionary* directories = dictionary_value(cache, explicitDirectoryCacheKey);
  restoreLocators(directories ? *directories : none);
  const PropertyListDictionary* entries = dictionary_value(cache, servicesCacheKey);
  restoreAppEntries(entries ? *entries : none);
  cacheIsLoaded_ = true;
}

void KELDataStore::restoreLocators(const PropertyListDictionary& directories) {
  auto locators = std::make_shared<Locators>();
  for (const auto& [directory, paths] : directories) {
    auto locator =
        std::make_shared<KELServicesProviderLocator>(platform_.files, platform_.log, directory.text());
    if (const PropertyListArray* array = paths.asArray()) {
      for (std::string& path : stringElements(*array)) locator->paths().insert(std::move(path));
    }
    // As of the position stored with it: the next update asks the journal what came later.
    locator->setDirectoryContentsCacheIsValid(true);
    locators->emplace(directory.text(), std::move(locator));
  }
  pathsToLocators_ = std::move(locators);
}

void KELDataStore::restoreAppEntries(const PropertyListDictionary& entries) {
  auto restored = std::make_shared<AppEntries>();
  for (const PropertyListDictionary::Entry& item : entries) {
    const std::string& path = item.first.text();
    auto entry = KELAppEntry::initFromCacheRepresentation(platform_, item.second, path);
    if (!entry) continue;
    send_debug_line([&] { return "Loaded cached entry " + entry->description() + " for path " + path; });
    entry->setServicesCacheIsValid(true);
    restored->emplace(path, std::move(entry));
  }
  pathsToAppEntries_ = std::move(restored);
}

PropertyListValue KELDataStore::cacheFileContents() const {
  PropertyListDictionaryBuilder directories;
  for (const auto& [directory, locator] : pathsToLocators_ ? *pathsToLocators_ : Locators()) {
    directories.set(directory, arrayOfStrings(locator->paths()));
  }
  PropertyListDictionaryBuilder entries;
  for (const auto& [path, entry] : pathsToAppEntries_ ? *pathsToAppEntries_ : AppEntries()) {
    entries.set(path, entry->cacheRepresentation());
  }
  PropertyListDictionaryBuilder contents;
  // Without a position everything is looked at again: what could not be read must not be taken for read.
  contents.set(lastEventIDKey, unsettledSources() ? 0 : eventStreamID_);
  contents.set(explicitDirectoryCacheKey, directories.build());
  contents.set(servicesCacheKey, entries.build());
  if (const auto lists = restriction_lists_to_plist(restrictionLists_.get()))
    contents.set(restrictionListsKey, *lists);
  if (pathsFromAR_) contents.set(registryPathsKey, arrayOfStrings(*pathsFromAR_));
  contents.set(sessionIDKey, boot_session_id(platform_));
  contents.set(buildVersionKey, operatingSystemBuildVersion());
  return contents.build();
}

void KELDataStore::writeCaches() {
  // Serialised here and not on the other queue: entries may be changed as soon as this returns.
  auto written = std::make_shared<const platform::PropertyListWriting>(
      platform::writeBinaryPropertyList(cacheFileContents()));
  auto work = [&files = platform_.files, path = cacheFilePath(), written] {
    if (!written->bytes) {
      send_debug_line([&] { return "Failed to make property list: " + written->error; });
      return;
    }
    const std::optional<std::string> error = path ? files.writeAtomically(*path, *written->bytes)
                                                  : std::optional<std::string>("no caches directory");
    send_debug_line([&] {
      return error ? "Failed to write cache file: " + *error
                   : "Wrote out cache file (" + std::to_string(written->bytes->size()) + " bytes)";
    });
  };
  writeQueue_.async(
      [work = std::move(work), sink = current_debug_sink(),
       transaction = platform::Transaction(platform_.transactions)] { run_with_debug_sink(sink, work); });
}

bool KELDataStore::cacheIsFromThisBootSession() {
  if (!cacheIsLoaded_) loadCache();
  return cacheSessionID_ == boot_session_id(platform_);
}

void KELDataStore::flushCaches() {
  restrictionLists_ = nullptr;
  cacheSessionID_ = std::nullopt;
  currentPublicDictionaries_ = std::nullopt;
  pathsToLocators_ = nullptr;
  pathsToAppEntries_ = nullptr;
  // The registry's paths stay: their changes are told, and asked for, on their own.
  writeQueue_.sync([this] {
    if (const std::optional<std::string> path = cacheFilePath()) platform_.files.remove(*path);
  });
  cacheIsLoaded_ = false;
}

}  // namespace kel
