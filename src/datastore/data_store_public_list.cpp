#include <algorithm>
#include <utility>

#include "common/common.h"
#include "common/service_keys.h"
#include "datastore/data_store.h"

namespace kel {

using platform::PropertyListDictionaryBuilder;
using platform::PropertyListValue;

namespace {

/// Well below what can be written: no single bundle, nor a few of them, may keep the list from being made.
constexpr std::uint64_t largestList = std::uint64_t{1} << 29;

/// The identifier as text; one of another kind, which only a cache file can hold, stands for itself by its
/// description.
std::optional<std::string> identifierText(const KELAppEntry& entry) {
  const std::optional<PropertyListValue> identifier = entry.bundleID();
  if (!identifier) return std::nullopt;
  const std::string* text = identifier->asString();
  return text ? *text : platform::describeBriefly(*identifier);
}

}  // namespace

const std::vector<std::string>& KELDataStore::validPathsForSpellCheckers() {
  if (!validPathsForSpellCheckers_) {
    validPathsForSpellCheckers_.emplace();
    for (const std::string& library : platform_.directories.libraryDirectories()) {
      validPathsForSpellCheckers_->push_back(platform::joinPath(library, "Services"));
    }
  }
  return *validPathsForSpellCheckers_;
}

void KELDataStore::removeInvalidSpellCheckers(std::vector<PropertyListDictionaryBuilder>& services) {
  const std::vector<std::string>& validPaths = validPathsForSpellCheckers();
  std::erase_if(services, [&](const PropertyListDictionaryBuilder& service) {
    if (!service.find(service_keys::QVSpellChecker)) return false;
    const std::string* path = string_value(service, service_keys::QVBundlePath);
    return !path || std::none_of(validPaths.begin(), validPaths.end(),
                                 [path](const std::string& valid) { return path->starts_with(valid); });
  });
}

std::vector<std::shared_ptr<KELAppEntry>> KELDataStore::uniquedAppEntries() const {
  using Keyed = std::pair<std::string, std::shared_ptr<KELAppEntry>>;
  std::vector<Keyed> result;
  std::map<std::string, std::shared_ptr<KELAppEntry>> byIdentifier;
  for (const auto& [path, entry] : pathsToAppEntries_ ? *pathsToAppEntries_ : AppEntries()) {
    const std::optional<std::string> identifier = identifierText(*entry);
    if (!identifier) {
      // Sorted as a missing identifier prints. Two bundles without one are no copies of each other.
      result.emplace_back("(null)", entry);
      continue;
    }
    std::shared_ptr<KELAppEntry>& held = byIdentifier[*identifier];
    if (!held || entry->shouldTakePriorityOverEntry(*held)) held = entry;
  }
  result.insert(result.end(), byIdentifier.begin(), byIdentifier.end());
  std::stable_sort(result.begin(), result.end(),
                   [](const Keyed& a, const Keyed& b) { return a.first < b.first; });

  std::vector<std::shared_ptr<KELAppEntry>> entries;
  entries.reserve(result.size());
  for (Keyed& keyed : result) entries.push_back(std::move(keyed.second));
  return entries;
}

const PropertyListValue& KELDataStore::currentPublicDictionaries() {
  if (currentPublicDictionaries_) return *currentPublicDictionaries_;
  if (!cacheIsLoaded_) loadCache();
  std::vector<PropertyListDictionaryBuilder> services;
  std::uint64_t size = 0;
  for (const auto& entry : uniquedAppEntries()) {
    const std::size_t before = services.size();
    entry->addPublicDictionariesForServices(services);
    for (std::size_t i = before; i < services.size(); ++i) size += services[i].expandedSize();
    if (size > largestList) {
      platform_.log.write("The services list is full; leaving out the services of " + entry->bundlePath() +
                          " and of what sorts after it");
      // Not the next, smaller bundle instead: what is left out should not change with every update.
      services.resize(before);
      break;
    }
  }
  removeInvalidSpellCheckers(services);
  apply_restriction_lists(services, restrictionLists_.get());

  platform::PropertyListArray list;
  list.reserve(services.size());
  for (const PropertyListDictionaryBuilder& service : services) list.emplace_back(service.build());
  return currentPublicDictionaries_.emplace(std::move(list));
}

void KELDataStore::fetchLocalizations(const std::optional<std::vector<std::string>>& localizations) {
  if (!localizations) return;
  send_debug_line([&] { return "Fetching localization(s): " + join(*localizations, ", "); });
  std::vector<std::shared_ptr<KELAppEntry>> entries;
  for (const auto& [path, entry] : pathsToAppEntries_ ? *pathsToAppEntries_ : AppEntries())
    entries.push_back(entry);
  apply_concurrently(platform_.concurrentQueue, entries, [&](const std::shared_ptr<KELAppEntry>& entry) {
    entry->loadLocalizations(*localizations);
  });
  currentPublicDictionaries_ = std::nullopt;
}

}  // namespace kel
