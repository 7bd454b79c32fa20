#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "common/queue_depths.h"
#include "discovery/path_changes_observer.h"
#include "discovery/services_provider_locator.h"
#include "entries/app_entry.h"
#include "platform/platform.h"
#include "restrictions/restriction_lists.h"

namespace kel {

/// What an update must look at again; other bits mean nothing. All bits set is a forced update.
using KELStaleCacheFlags = std::int32_t;
inline constexpr KELStaleCacheFlags KELStaleAppRegistryPaths = 1;
inline constexpr KELStaleCacheFlags KELStaleServiceDirectories = 2;
inline constexpr KELStaleCacheFlags KELStaleRestrictionLists = 4;
inline constexpr KELStaleCacheFlags KELStaleEverything = -1;

/// The services cache: one entry per bundle path, kept up to date with the disk, remembered in one file, and
/// turned into the list of public service dictionaries.
///
/// Affinity: one serial queue (the server's data-store queue), construction and destruction excepted. Only
/// file writes run on a queue of the store's own. Nothing reports failure to its caller; what goes wrong
/// shows in the debug sink. Borrows the platform, which outlives it.
class KELDataStore {
 public:
  using AppEntries = std::map<std::string, std::shared_ptr<KELAppEntry>>;
  using Locators = std::map<std::string, std::shared_ptr<KELServicesProviderLocator>>;

  static std::unique_ptr<KELDataStore> initWithSystemServices(platform::Platform& platform);

  /// The cache file's path; absent when the platform gives no caches directory.
  std::optional<std::string> cacheFilePath() const;

  /// What system and program this is; a cache written by another one is not loaded.
  const std::string& operatingSystemBuildVersion() const;
  bool validateCacheDictionaryVersion(const platform::PropertyListDictionary& dictionary) const;

  /// The cache file's contents; absent when they cannot be read or are another version's.
  std::optional<platform::PropertyListDictionary> cacheDictionary() const;

  /// Brings the entries up to date with the sources named by `flags`, and with those that are not known yet.
  /// May block for as long as reading every bundle takes.
  void updateServicesCache(KELStaleCacheFlags flags);

  /// What an update must look at again because it could not be read for the moment; absent when there is
  /// nothing. 0 is not nothing: single bundles, which every update looks at again.
  std::optional<KELStaleCacheFlags> unsettledSources() const;

  /// Writes the cache file in the background, as the store stands now.
  void writeCaches();

  /// Fills the store from the cache file, or from nothing.
  void loadCache();

  /// True when the loaded cache (loaded now if need be) was written in this boot and login session.
  bool cacheIsFromThisBootSession();

  /// Forgets what is cached and deletes the cache file. Waits for queued writes.
  void flushCaches();

  /// The directories in which spell checkers may live, without a trailing "/".
  const std::vector<std::string>& validPathsForSpellCheckers();

  /// Removes the spell-checker services of bundles that lie elsewhere.
  void removeInvalidSpellCheckers(std::vector<platform::PropertyListDictionaryBuilder>& services);

  /// One entry per bundle identifier and every entry without one, sorted by identifier.
  std::vector<std::shared_ptr<KELAppEntry>> uniquedAppEntries() const;

  /// The list of public service dictionaries, an array; built when there is none. The same value until an
  /// update, a fetch of localizations or a flush.
  const platform::PropertyListValue& currentPublicDictionaries();

  /// Makes every entry load the first of `localizations` that it has. Absent: nothing happens at all.
  void fetchLocalizations(const std::optional<std::vector<std::string>>& localizations);

 private:
  struct UpdateResults;

  explicit KELDataStore(platform::Platform& platform) : platform_(platform) {}

  platform::PropertyListValue cacheFileContents() const;
  void restoreLocators(const platform::PropertyListDictionary& directories);
  void restoreAppEntries(const platform::PropertyListDictionary& entries);

  KELStaleCacheFlags widenedFlags(KELStaleCacheFlags flags) const;
  std::shared_ptr<KELPathChangesObserver> readStaleSources(KELStaleCacheFlags flags);
  std::shared_ptr<const Locators> refreshedLocators(KELPathChangesObserver* observer) const;
  std::set<std::string> candidatePaths() const;
  AppEntries entriesForCandidates(const std::set<std::string>& candidates,
                                  std::vector<std::string>& unchangedPaths) const;

  platform::Platform& platform_;
  std::optional<platform::PropertyListValue> currentPublicDictionaries_;
  std::optional<std::string> cacheSessionID_;
  std::shared_ptr<const KELRestrictionLists> restrictionLists_;
  std::shared_ptr<const Locators> pathsToLocators_;
  std::shared_ptr<const std::vector<std::string>> pathsFromAR_;
  std::shared_ptr<const AppEntries> pathsToAppEntries_;
  std::optional<std::vector<std::string>> validPathsForSpellCheckers_;
  platform::SerialQueue writeQueue_{"Datastore Write Queue", queue_depths::datastoreWrites};
  platform::EventID eventStreamID_ = 0;
  bool cacheIsLoaded_ = false;
  bool registryIsUnsettled_ = false;
  bool restrictionsAreUnsettled_ = false;
};

}  // namespace kel
