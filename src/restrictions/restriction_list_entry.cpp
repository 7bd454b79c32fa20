#include "restrictions/restriction_list_entry.h"

#include <utility>

#include "common/service_keys.h"

namespace kel {

namespace {

using platform::PropertyListDictionary;
using platform::PropertyListString;
using platform::PropertyListValue;

const PropertyListString bundleIDKey = "QVBundleID";

}  // namespace

KELRestrictionListEntry::KELRestrictionListEntry(PropertyListString bundleID, PropertyListString title)
    : bundleID_(std::move(bundleID)), title_(std::move(title)) {}

std::optional<KELRestrictionListEntry> KELRestrictionListEntry::initWithBundleID(
    std::optional<PropertyListString> bundleID, std::optional<PropertyListString> title) {
  if (!bundleID || !title) return std::nullopt;
  return KELRestrictionListEntry(*std::move(bundleID), *std::move(title));
}

std::optional<KELRestrictionListEntry> KELRestrictionListEntry::initWithDictionaryRepresentation(
    const PropertyListValue& representation) {
  const PropertyListDictionary* row = representation.asDictionary();
  if (!row) return std::nullopt;
  return initWithBundleID(copied(shared_string_value(*row, bundleIDKey)),
                          copied(shared_string_value(*row, service_keys::QVMenuItem)));
}

PropertyListDictionary KELRestrictionListEntry::dictionaryRepresentation() const {
  return PropertyListDictionary({{bundleIDKey, bundleID_}, {service_keys::QVMenuItem, title_}});
}

}  // namespace kel
