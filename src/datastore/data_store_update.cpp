// What one update does, in this order.
//
// 1. It widens the flags by every source that nothing is known of yet. An empty list of paths counts as
//    unknown: to ask again costs little, never to ask would cost the services.
// 2. It reads the stale sources side by side: the service directories, the application registry, the
//    restrictions file. The journal's position is taken before any of them is read: a change made meanwhile
//    is seen by the next update, twice at worst. A position taken afterwards would lose it.
// 3. It puts together the candidates, bundle paths from the registry and from all directories, and finds or
//    makes the entry of each. An entry that is no candidate any more is not carried over.
// 4. When directories were stale it asks the journal about the bundles of valid entries, and takes their
//    validity from those that changed; from all of them where there is no position to ask from. A change
//    within a bundle has left the listing of its directory valid: it costs that bundle alone.
// 5. It loads every entry that is not valid, in parallel, drops those that cannot be loaded, and installs the
//    rest. A bundle that dropped out has no entry, and so is tried again by the next update.
//
// Never happens: a list that is half old and half new, because the new entries are installed at once and this
// queue is the only reader; a bundle read without need, unless the journal cannot tell; an update that fails:
// a directory that cannot be listed counts as empty, and a missing restrictions file leaves the lists as they
// were.

#include <algorithm>
#include <utility>

#include "common/common.h"
#include "common/path_set.h"
#include "datastore/data_store.h"
#include "discovery/bundle_paths.h"

namespace kel {

namespace {

template <typename Map>
auto mapValues(const Map& map) {
  std::vector<typename Map::mapped_type> values;
  values.reserve(map.size());
  for (const auto& [key, value] : map) values.push_back(value);
  return values;
}

/// True when something changed in the directory itself, outside every entry that the locator knows.
bool changedOutsideKnownPaths(const std::set<std::string>& changedPaths,
                              const KELServicesProviderLocator& locator) {
  if (changedPaths.empty()) return false;
  PathSet known;
  for (const std::string& path : locator.paths()) known.insert(path);
  return !std::all_of(changedPaths.begin(), changedPaths.end(),
                      [&known](const std::string& changed) { return known.holdsPrefixOf(changed); });
}

bool hasChanged(const std::string& path, KELPathChangesObserver* observer) {
  return !observer || observer->pathChangedOrRequiresRescan(path) ||
         !observer->changedPathsUnderPath(path).empty();
}

}  // namespace

void KELDataStore::updateServicesCache(KELStaleCacheFlags flags) {
  if (!cacheIsLoaded_) loadCache();
  flags = widenedFlags(flags);
  currentPublicDictionaries_ = std::nullopt;
  const std::shared_ptr<KELPathChangesObserver> observer = readStaleSources(flags);

  std::vector<std::string> unchangedPaths;
  AppEntries entries = entriesForCandidates(candidatePaths(), unchangedPaths);
  if (flags & KELStaleServiceDirectories) {
    if (observer) observer->observeChangesUnderPaths(paths_to_observe(unchangedPaths));
    for (const auto& [path, entry] : entries) {
      if (entry->servicesCacheIsValid() && hasChanged(entry->bundlePath(), observer.get())) {
        entry->setServicesCacheIsValid(false);
      }
    }
  }
  apply_concurrently(platform_.concurrentQueue, mapValues(entries),
                     [](const std::shared_ptr<KELAppEntry>& entry) { entry->refreshCache(); });
  // Kept, an entry that failed would be taken for known by the next update, and its old values for true. One
  // that could not be read for the moment keeps what was known, and is not valid.
  std::erase_if(entries, [](const auto& item) {
    return !item.second->servicesCacheIsValid() && !item.second->bundleIsUnsettled();
  });
  pathsToAppEntries_ = std::make_shared<const AppEntries>(std::move(entries));
}

KELStaleCacheFlags KELDataStore::widenedFlags(KELStaleCacheFlags flags) const {
  if (!pathsFromAR_ || pathsFromAR_->empty()) flags |= KELStaleAppRegistryPaths;
  if (!restrictionLists_) flags |= KELStaleRestrictionLists;
  if (!pathsToLocators_ || pathsToLocators_->empty()) flags |= KELStaleServiceDirectories;
  return flags;
}

std::optional<KELStaleCacheFlags> KELDataStore::unsettledSources() const {
  KELStaleCacheFlags flags = 0;
  if (registryIsUnsettled_) flags |= KELStaleAppRegistryPaths;
  if (restrictionsAreUnsettled_) flags |= KELStaleRestrictionLists;
  const auto isUnsettled = [](const auto& item) { return item.second->isUnsettled(); };
  if (pathsToLocators_ && std::ranges::any_of(*pathsToLocators_, isUnsettled))
    flags |= KELStaleServiceDirectories;
  // An entry is looked at again by every update, whatever its flags.
  const bool entryIsUnsettled = pathsToAppEntries_ && std::ranges::any_of(*pathsToAppEntries_, isUnsettled);
  return flags != 0 || entryIsUnsettled ? std::optional(flags) : std::nullopt;
}

/// Reads the sources named by `flags` in parallel and installs what they gave. Returns the observer of
/// changes since the last look at the directories, when they are looked at now and that position is known.
std::shared_ptr<KELPathChangesObserver> KELDataStore::readStaleSources(KELStaleCacheFlags flags) {
  std::shared_ptr<KELPathChangesObserver> observer;
  std::shared_ptr<const Locators> newLocators;
  RegistryPaths newRegistryPaths;
  platform::DictionaryReading newRestrictions;

  platform::Group group;
  const auto start = [this, &group, sink = current_debug_sink()](std::function<void()> task) {
    group.async(platform_.concurrentQueue,
                [sink, task = std::move(task)] { run_with_debug_sink(sink, task); });
  };
  if (flags & KELStaleServiceDirectories) {
    if (eventStreamID_ != 0) {
      observer = std::make_shared<KELPathChangesObserver>(platform_.journal, platform_.clock, eventStreamID_);
    }
    // Taken before any scan starts, so that a change made meanwhile is seen by the next update.
    eventStreamID_ = platform_.journal.currentEventID();
    start([&] { newLocators = refreshedLocators(observer.get()); });
  }
  if (flags & KELStaleAppRegistryPaths) {
    start([&] { newRegistryPaths = service_providing_paths(platform_); });
  }
  if (flags & KELStaleRestrictionLists) {
    start([&] { newRestrictions = load_restrictions_file(platform_); });
  }
  group.wait();

  if (newLocators) pathsToLocators_ = std::move(newLocators);
  if (flags & KELStaleAppRegistryPaths) {
    if (!std::exchange(registryIsUnsettled_, !newRegistryPaths.isWhole) && registryIsUnsettled_) {
      platform_.log.write("Cannot be read for now, trying again: some applications");
    }
    // A part of the applications takes the place of none, never that of all that were known.
    if (newRegistryPaths.isWhole || !pathsFromAR_ || pathsFromAR_->empty()) {
      pathsFromAR_ = std::make_shared<const std::vector<std::string>>(std::move(newRegistryPaths.paths));
    }
  }
  if (flags & KELStaleRestrictionLists) {
    if (!std::exchange(restrictionsAreUnsettled_, newRestrictions.isTransient) && restrictionsAreUnsettled_) {
      platform_.log.write("Cannot be read for now, trying again: " + newRestrictions.error);
    }
    if (auto lists = restriction_lists_from_plist(newRestrictions.dictionary))
      restrictionLists_ = std::move(lists);
  }
  return observer;
}

std::shared_ptr<const KELDataStore::Locators> KELDataStore::refreshedLocators(
    KELPathChangesObserver* observer) const {
  std::vector<std::string> unchangedDirectories;
  auto locators = std::make_shared<Locators>();
  for (const std::string& directory : explicit_service_directories(platform_.directories)) {
    std::shared_ptr<KELServicesProviderLocator> locator;
    if (pathsToLocators_) {
      if (const auto known = pathsToLocators_->find(directory); known != pathsToLocators_->end()) {
        locator = known->second;
      }
    }
    // A new locator is listed in any case: there is nothing that the journal could keep valid.
    if (!locator) {
      locator = std::make_shared<KELServicesProviderLocator>(platform_.files, platform_.log, directory);
    } else if (locator->directoryContentsCacheIsValid()) {
      unchangedDirectories.push_back(directory);
    }
    locators->insert_or_assign(directory, std::move(locator));
  }
  if (observer) observer->observeChangesUnderPaths(unchangedDirectories);

  for (const auto& [directory, locator] : *locators) {
    if (!locator->directoryContentsCacheIsValid()) continue;
    const std::string& base = locator->basePath();
    if (!observer || observer->pathChangedOrRequiresRescan(base) ||
        changedOutsideKnownPaths(observer->changedPathsUnderPath(base), *locator)) {
      locator->setDirectoryContentsCacheIsValid(false);
    }
  }
  apply_concurrently(
      platform_.concurrentQueue, mapValues(*locators),
      [](const std::shared_ptr<KELServicesProviderLocator>& locator) { locator->refreshCache(); });
  return locators;
}

std::set<std::string> KELDataStore::candidatePaths() const {
  std::set<std::string> candidates;
  if (pathsFromAR_) candidates.insert(pathsFromAR_->begin(), pathsFromAR_->end());
  for (const auto& [directory, locator] : pathsToLocators_ ? *pathsToLocators_ : Locators()) {
    candidates.insert(locator->paths().begin(), locator->paths().end());
  }
  std::erase_if(candidates, [](const std::string& path) {
    if (path.find(".tqarchive/") == std::string::npos) return false;
    send_debug_line([&] { return "Skipping file inside .tqarchive: " + path; });
    return true;
  });
  return candidates;
}

KELDataStore::AppEntries KELDataStore::entriesForCandidates(const std::set<std::string>& candidates,
                                                            std::vector<std::string>& unchangedPaths) const {
  AppEntries entries;
  for (const std::string& path : candidates) {
    const auto known = pathsToAppEntries_ ? pathsToAppEntries_->find(path) : AppEntries::const_iterator();
    if (pathsToAppEntries_ && known != pathsToAppEntries_->end()) {
      send_debug_line([&] { return "Found entry " + known->second->description() + " for path " + path; });
      if (known->second->servicesCacheIsValid()) unchangedPaths.push_back(path);
      entries.emplace_hint(entries.end(), path, known->second);
    } else {
      auto entry = KELAppEntry::initWithBundlePath(platform_, path);
      send_debug_line([&] { return "Creating entry " + entry->description() + " for path " + path; });
      entries.emplace_hint(entries.end(), path, std::move(entry));
    }
  }
  return entries;
}

}  // namespace kel
