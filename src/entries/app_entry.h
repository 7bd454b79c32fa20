#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "entries/app_entry_validation.h"
#include "platform/bundles.h"
#include "platform/guarded.h"
#include "platform/platform.h"
#include "property_lists/digest.h"
#include "property_lists/property_list_value.h"

namespace kel {

/// What is known of one bundle that may offer services: its identity, its declared services, and the menu
/// strings fetched so far.
///
/// Values come from the bundle's information dictionary or from the cache file and are kept as found, of
/// whatever kind; those from a bundle are validated, those from the cache never.
///
/// Any thread, one operation at a time; the properties may be read at any time and are whole then. Entries
/// share nothing, so that different ones can be worked on in parallel. Borrows the platform.
class KELAppEntry {
 public:
  using Value = std::optional<platform::PropertyListValue>;

  /// A new entry, not valid, with nothing known but the path of the bundle's directory.
  static std::shared_ptr<KELAppEntry> initWithBundlePath(platform::Platform& platform,
                                                         std::string bundlePath);

  /// An entry with the fields that `cacheRepresentation` gave, not valid yet. Null when `representation` is
  /// none or no dictionary.
  static std::shared_ptr<KELAppEntry> initFromCacheRepresentation(platform::Platform& platform,
                                                                  const Value& representation,
                                                                  std::string bundlePath);

  KELAppEntry(const KELAppEntry&) = delete;
  KELAppEntry& operator=(const KELAppEntry&) = delete;

  /// What the cache file stores for the entry: the fields that are present.
  platform::PropertyListDictionary cacheRepresentation() const;

  /// How messages name the entry: its class and its address.
  std::string description() const;

  /// Opens the bundle; null when there is none at the path. Closed by whoever holds it.
  std::unique_ptr<platform::Bundle> createBundle() const;

  /// Unless the entry is valid, loads the bundle and becomes valid when that succeeds. A bundle that cannot
  /// be opened is told to the debug sink.
  void refreshCache();

  /// Takes identifier, name, version and declared services from `bundle` (may be null: false, and nothing
  /// changes) and forgets the menu strings when any of them is new. False, with a report in the system log,
  /// when they are malformed; they are kept all the same. False also when they cannot be read for the moment:
  /// then nothing changes, and the system log is told once.
  bool loadFromBundle(platform::Bundle* bundle);

  /// Finds menu strings for the first of `localizations`, most preferred first, that the bundle has a usable
  /// file for. Those before it are remembered as having none, so that the disk is not searched again. At one
  /// that cannot be read for the moment the search ends, to be made again.
  void loadLocalizations(const std::vector<std::string>& localizations);

  /// True when the four values read from the bundle have the kinds that services need; otherwise false, and
  /// with `log` one report of all problems goes to the system log.
  bool validateEntryPlistFormatOptionallyLoggingErrors(bool log) const;

  /// The part of the above that concerns the four values themselves. `errors` may be null.
  bool validateBaseServiceKeysIntoErrors(ValidationErrors* errors) const;

  /// Appends the public form of every declared service, in order. At the first one with a value that cannot
  /// be handled (possible with values from the cache) it stops, with a line in the system log.
  void addPublicDictionariesForServices(std::vector<platform::PropertyListDictionaryBuilder>& services) const;

  /// Whether this entry is preferred to `other`, which has the same bundle identifier: by the precedence of
  /// their directories, then by being on the boot volume, then by the shorter path. The reason goes to the
  /// debug sink.
  bool shouldTakePriorityOverEntry(const KELAppEntry& other) const;

  /// The bundle's identifier, name and version, and the array of its declared services.
  Value bundleID() const { return bundleID_.copy(); }
  Value bundleName() const { return bundleName_.copy(); }
  Value bundleVersion() const { return bundleVersion_.copy(); }
  Value infoPlistServiceDictionaries() const { return infoPlistServiceDictionaries_.copy(); }
  void setBundleID(Value value) { bundleID_.set(std::move(value)); }
  void setBundleName(Value value) { bundleName_.set(std::move(value)); }
  void setBundleVersion(Value value) { bundleVersion_.set(std::move(value)); }
  void setInfoPlistServiceDictionaries(Value value) { infoPlistServiceDictionaries_.set(std::move(value)); }

  /// A dictionary from the name of a localization to its strings table, or to false when it was looked up and
  /// has none.
  Value localizationToMenuStrings() const { return localizationToMenuStrings_.copy(); }
  void setLocalizationToMenuStrings(Value value) { localizationToMenuStrings_.set(std::move(value)); }

  /// The bundle's directory, exactly as the entry was created with.
  const std::string& bundlePath() const { return bundlePath_.text(); }

  /// The fields reflect the bundle on disk and passed validation.
  bool servicesCacheIsValid() const { return servicesCacheIsValid_; }
  void setServicesCacheIsValid(bool valid) { servicesCacheIsValid_ = valid; }

  /// The bundle, or a strings file of it, could not be read for the moment: what is known of it stays, and it
  /// is to be looked at again.
  bool bundleIsUnsettled() const { return !bundleError_.empty(); }
  bool isUnsettled() const { return bundleIsUnsettled() || !stringsError_.empty(); }

 private:
  struct MenuStringsTables;

  KELAppEntry(platform::Platform& platform, std::string bundlePath);

  Value lookUpMenuStrings(platform::Bundle& bundle, const std::string& localization);
  bool settle(std::string& source, std::string error);

  // These two throw for a value that they cannot handle.
  platform::PropertyListDictionaryBuilder transformServiceDictionaryForPlist(
      const platform::PropertyListValue& declaredService, std::uint32_t index,
      const MenuStringsTables& tables) const;
  static void applyAvailableLocalizationsToMenuItemNamesOrKeyEquivalents(
      platform::PropertyListDictionaryBuilder& titles, const MenuStringsTables& tables);

  platform::Platform& platform_;
  const platform::PropertyListString bundlePath_;
  const platform::Digest app_id_;  // always the same for one path; its services' UUIDs derive from it

  platform::Guarded<Value> bundleID_;
  platform::Guarded<Value> bundleName_;
  platform::Guarded<Value> bundleVersion_;
  platform::Guarded<Value> infoPlistServiceDictionaries_;
  platform::Guarded<Value> localizationToMenuStrings_;
  bool servicesCacheIsValid_ = false;

  // Why the bundle and a strings file could not be read for the moment; empty when they could.
  std::string bundleError_;
  std::string stringsError_;
};

/// The directories whose bundles win over copies elsewhere, highest precedence first. Built at the first use
/// and kept by the platform. Any thread.
const std::vector<std::string>& service_directory_precedence(platform::Platform& platform);

}  // namespace kel
