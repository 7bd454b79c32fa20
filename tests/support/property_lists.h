#pragma once

#include <gmock/gmock.h>
#include <string>
#include <utility>
#include <vector>

#include "property_lists/property_list_value.h"
#include "support/print.h"

namespace kel::test {

using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::MatchesRegex;
using testing::SizeIs;
using testing::StartsWith;
using Array = platform::PropertyListArray;
using Dictionary = platform::PropertyListDictionary;
using DictionaryBuilder = platform::PropertyListDictionaryBuilder;
using Entries = std::vector<Dictionary::Entry>;
using Names = std::vector<std::string>;
using Value = platform::PropertyListValue;

inline Dictionary dictionary(Entries entries) { return Dictionary(std::move(entries)); }

/// A list of `rows`, several on one line.
template <typename T, typename... Row>
std::vector<T> listOf(const Row&... rows) {
  return {T(rows)...};
}

/// The declaration of a service, and an information dictionary with just that one.
inline Dictionary service(const std::string& title) {
  return dictionary({{"QVMenuItem", dictionary({{"default", title}})}, {"QVMessage", "go"}});
}
inline Dictionary information(const std::string& identifier, const std::string& title) {
  return dictionary({{"KTBundleIdentifier", identifier}, {"QVServices", Array{service(title)}}});
}

/// The titles of a service in a public list, by localization.
inline Dictionary menuItem(const Value& list, std::size_t index) {
  return *list.asArray()->at(index).asDictionary()->find("QVMenuItem")->asDictionary();
}

/// The default titles of a public list, in its order.
inline Names defaultTitles(const Value& list) {
  Names titles;
  for (std::size_t index = 0; index < list.asArray()->size(); ++index)
    titles.push_back(*menuItem(list, index).find("default")->asString());
  return titles;
}

}  // namespace kel::test
