// From what a bundle declares to what clients see.
//
// A declared service is a dictionary that somebody wrote by hand: its keys come in any letter case and with
// blanks in them. They are normalised first, and what the table of service keys does not know is dropped. Of
// the rest the table says what is carried over as it is; message, titles, key equivalents, the restriction
// and the identity are made here.
//
// Titles and key equivalents become dictionaries from the name of a localization to a text. The declared ones
// stand in them first; the one under "default" is then looked up in every strings table that the entry has
// loaded, and what is found takes its place under the table's localization. One table serves titles and key
// equivalents alike.
//
// A service's identity is a digest of its bundle's path and its place in the declaration. So it outlives
// restarts and updates of the bundle, and nothing about it has to be stored.
//
// Values are validated when they come from a bundle, but never when they come from the cache file, so that
// everything here may be of any kind. What is odd inside a service is left out of it; what makes a service
// impossible ends its bundle's services with a line in the log, and those before it stay.
//
// Never happens: a value is copied, since public dictionaries share what was declared; one bundle fills the
// list, since its services are counted at full size however much they share.

#include <algorithm>
#include <array>
#include <map>
#include <stdexcept>
#include <utility>

#include "entries/app_entry.h"
#include "entries/service_key_table.h"
#include "property_lists/unicode.h"

namespace kel {

namespace {

using platform::PropertyListArray;
using platform::PropertyListDictionary;
using platform::PropertyListDictionaryBuilder;
using platform::PropertyListString;
using platform::PropertyListValue;

/// How large the services of one bundle may be in all: short declarations can share long texts.
constexpr std::uint64_t largestServices = 16 * 1024 * 1024;

/// A value of a kind that a public dictionary cannot be made from.
struct UnusableValue : std::runtime_error {
  using std::runtime_error::runtime_error;
};

/// `key` without spaces and tabs, in lower case. Absent for a key so long that it cannot be a known one.
std::optional<std::string> normalisedKey(std::string_view key) {
  // The longest known key has 25 letters, and the lower case of a character of more than three bytes is never
  // an ASCII letter.
  constexpr std::size_t longest = 3 * std::string_view("qvsupportsfiletranslation").size();
  std::string result;
  for (const char c : key) {
    if (c == ' ' || c == '\t') continue;
    if (result.size() == longest) return std::nullopt;
    result += c;
  }
  return platform::lowerCase(result);
}

/// The declared values of a service that count, by the names their keys are published under. Borrows them.
class DeclaredService {
 public:
  explicit DeclaredService(const PropertyListDictionary& declared) {
    for (const auto& [key, value] : declared) {
      const std::optional<std::string> normalised = normalisedKey(key);
      for (const ServiceKey& known : service_keys::table)
        if (known.declared == normalised) values_.emplace(known.published, &value);
    }
    // An earlier kind of service hides the later ones, and only filters translate.
    if (find(service_keys::QVSpellChecker)) values_.erase(service_keys::QVFilter);
    if (!find(service_keys::QVFilter)) {
      values_.erase(service_keys::QVSupportsFileTranslation);
      values_.erase(service_keys::QVSupportsDataTranslation);
    }
    // Send types of the wrong kind hide the languages too.
    if (find(service_keys::QVSendTypes)) values_.erase(service_keys::QVLanguages);
  }

  /// The declared value, or null.
  const PropertyListValue* find(std::string_view published) const {
    const auto found = values_.find(published);
    return found == values_.end() ? nullptr : found->second;
  }

 private:
  std::map<std::string_view, const PropertyListValue*> values_;
};

void carryOver(const DeclaredService& declared, PropertyListDictionaryBuilder& service) {
  for (const ServiceKey& key : service_keys::table) {
    const PropertyListValue* value = declared.find(key.published);
    if (value && key.isCarriedOver(*value)) service.set(key.published, *value);
  }
}

void addMessage(const DeclaredService& declared, PropertyListDictionaryBuilder& service) {
  const PropertyListValue* message = declared.find(service_keys::QVSpellChecker);
  if (!message) message = declared.find(service_keys::QVFilter);
  if (!message) message = declared.find(service_keys::QVMessage);
  if (message && message->asString()) service.set(service_keys::QVMessage, *message);
}

PropertyListDictionaryBuilder declaredTitles(const PropertyListValue* declared, bool keepEmpty) {
  PropertyListDictionaryBuilder titles;
  if (!declared) return titles;
  if (declared->asString()) {
    titles.set(service_keys::defaultTitle, *declared);
  } else if (const PropertyListDictionary* pairs = declared->asDictionary()) {
    for (const auto& [localization, title] : *pairs) {
      const std::string* text = title.asString();
      if (text && (keepEmpty || !text->empty())) titles.set(localization, title);
    }
  }
  return titles;
}

bool textAsBoolean(std::string_view text) {
  const auto dropLeading = [&](std::string_view characters) {
    text.remove_prefix(std::min(text.find_first_not_of(characters), text.size()));
  };
  dropLeading(" \t\n\v\f\r");
  if (text.starts_with('+') || text.starts_with('-')) text.remove_prefix(1);
  dropLeading("0");  // "007" is true by its 7
  return !text.empty() && std::string_view("YyTt123456789").find(text.front()) != std::string_view::npos;
}

bool asBoolean(const PropertyListValue& value) {
  if (const std::string* text = value.asString()) return textAsBoolean(*text);
  if (const auto boolean = value.asBoolean()) return *boolean;
  if (const auto integer = value.asInteger()) return integer->bits != 0;
  if (const auto real = value.asReal()) return *real != 0;
  return true;
}

platform::Bytes serviceUUID(const platform::Digest& key, std::uint32_t index) {
  std::array<std::uint8_t, 4> littleEndian{};
  for (std::size_t i = 0; i < littleEndian.size(); ++i)
    littleEndian[i] = static_cast<std::uint8_t>(index >> (8 * i));
  const platform::Digest digest = platform::hmacMD5(key, littleEndian);
  return platform::Bytes(digest.begin(), digest.end());
}

}  // namespace

/// The strings tables of an entry without the markers of localizations that have none: a client may have
/// asked for many of those, and every service goes through what is left.
struct KELAppEntry::MenuStringsTables {
  explicit MenuStringsTables(const Value& localizationToMenuStrings) {
    if (!localizationToMenuStrings) return;
    const PropertyListDictionary* all = localizationToMenuStrings->asDictionary();
    if (!all) {
      failure = "the localized menu strings are no dictionary";
      return;
    }
    for (const auto& [localization, value] : *all) {
      if (value.asDictionary()) {
        tables.emplace_back(localization, value);
      } else if (value.asBoolean() != false) {
        failure =
            "the menu strings of localization " + localization.text() + " are neither a table nor false";
      }
    }
  }

  std::vector<PropertyListDictionary::Entry> tables;
  std::string failure;  ///< why the tables cannot be applied; empty when they can
};

PropertyListDictionaryBuilder KELAppEntry::transformServiceDictionaryForPlist(
    const PropertyListValue& declaredService, std::uint32_t index, const MenuStringsTables& tables) const {
  const PropertyListDictionary* dictionary = declaredService.asDictionary();
  if (!dictionary) throw UnusableValue("service " + std::to_string(index) + " is no dictionary");
  const DeclaredService declared(*dictionary);

  PropertyListDictionaryBuilder service;
  carryOver(declared, service);
  addMessage(declared, service);
  service.set(service_keys::QVBundlePath, bundlePath_);
  if (Value identifier = bundleID()) service.set(service_keys::QVBundleIdentifier, *std::move(identifier));
  if (const PropertyListValue* restricted = declared.find(service_keys::QVRestricted))
    service.set(service_keys::QVRestricted, asBoolean(*restricted));

  // An empty title is still one; an empty key equivalent in a dictionary means none.
  PropertyListDictionaryBuilder titles = declaredTitles(declared.find(service_keys::QVMenuItem), true);
  PropertyListDictionaryBuilder keyEquivalents =
      declaredTitles(declared.find(service_keys::QVKeyEquivalent), false);
  applyAvailableLocalizationsToMenuItemNamesOrKeyEquivalents(titles, tables);
  applyAvailableLocalizationsToMenuItemNamesOrKeyEquivalents(keyEquivalents, tables);
  service.set(service_keys::QVMenuItem, titles.build());
  service.set(service_keys::QVKeyEquivalent, keyEquivalents.build());
  service.set(service_keys::QVUUID, serviceUUID(app_id_, index));
  return service;
}

void KELAppEntry::applyAvailableLocalizationsToMenuItemNamesOrKeyEquivalents(
    PropertyListDictionaryBuilder& titles, const MenuStringsTables& tables) {
  const PropertyListValue* found = titles.find(service_keys::defaultTitle);
  if (!found) return;
  if (!tables.failure.empty()) throw UnusableValue(tables.failure);
  // A copy: a localization may itself be called "default".
  const PropertyListString defaultTitle = *found->asSharedString();
  for (const auto& [localization, table] : tables.tables) {
    if (const PropertyListValue* translation = table.asDictionary()->find(defaultTitle))
      titles.set(localization, *translation);
  }
}

void KELAppEntry::addPublicDictionariesForServices(
    std::vector<PropertyListDictionaryBuilder>& services) const {
  const Value declared = infoPlistServiceDictionaries();
  if (!declared) return;
  try {
    const PropertyListArray* declaredServices = declared->asArray();
    if (!declaredServices) throw UnusableValue("the declared services are no array");
    const MenuStringsTables tables(localizationToMenuStrings());
    std::uint32_t index = 0;
    std::uint64_t size = 0;
    for (const PropertyListValue& declaredService : *declaredServices) {
      PropertyListDictionaryBuilder service =
          transformServiceDictionaryForPlist(declaredService, index++, tables);
      size += service.expandedSize();
      if (size > largestServices) throw UnusableValue("its services are too large");
      services.push_back(std::move(service));
    }
  } catch (const UnusableValue& failure) {
    platform_.log.write("Exception processing Services at path " + bundlePath() + ": " + failure.what());
  }
}

}  // namespace kel
