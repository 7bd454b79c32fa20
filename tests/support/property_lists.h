#pragma once

#include <string>
#include <utility>
#include <vector>

#include "platform/property_list_value.h"
#include "support/print.h"

namespace kel::test {

inline platform::PropertyListDictionary dictionary(
    std::vector<platform::PropertyListDictionary::Entry> entries) {
  return platform::PropertyListDictionary(std::move(entries));
}

/// The default titles of a public list, in its order.
inline std::vector<std::string> defaultTitles(const platform::PropertyListValue& list) {
  std::vector<std::string> titles;
  for (const platform::PropertyListValue& service : *list.asArray()) {
    const auto* menuItem = service.asDictionary()->find("QVMenuItem")->asDictionary();
    titles.push_back(*menuItem->find("default")->asString());
  }
  return titles;
}

}  // namespace kel::test
