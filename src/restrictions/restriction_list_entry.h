#pragma once

#include <optional>

#include "property_lists/property_list_value.h"

namespace kel {

/// One row of a restriction list: the service of `bundleID` whose default menu title is `title` (a submenu,
/// "/" and the item's name count as one title). An immutable value; compared exactly.
class KELRestrictionListEntry {
 public:
  /// None when either argument is none.
  static std::optional<KELRestrictionListEntry> initWithBundleID(
      std::optional<platform::PropertyListString> bundleID,
      std::optional<platform::PropertyListString> title);

  /// None unless `representation` is a dictionary with strings under "QVBundleID" and "QVMenuItem".
  static std::optional<KELRestrictionListEntry> initWithDictionaryRepresentation(
      const platform::PropertyListValue& representation);

  /// The storable form: the two strings under the keys above.
  platform::PropertyListDictionary dictionaryRepresentation() const;

  const platform::PropertyListString& bundleID() const { return bundleID_; }
  const platform::PropertyListString& title() const { return title_; }

  bool operator==(const KELRestrictionListEntry&) const = default;

 private:
  KELRestrictionListEntry(platform::PropertyListString bundleID, platform::PropertyListString title);

  platform::PropertyListString bundleID_;
  platform::PropertyListString title_;
};

}  // namespace kel
