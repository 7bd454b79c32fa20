#pragma once

#include <gmock/gmock.h>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "entries/app_entry.h"
#include "support/debug_lines.h"
#include "support/in_memory_platform.h"
#include "support/print.h"

namespace kel::test {

inline platform::PropertyListDictionary dictionary(
    std::vector<platform::PropertyListDictionary::Entry> entries) {
  return platform::PropertyListDictionary(std::move(entries));
}

/// A platform and one bundle path.
class EntryTest : public testing::Test {
 protected:
  using Array = platform::PropertyListArray;
  using Value = platform::PropertyListValue;

  /// An entry as the cache file would give it back: nothing of it is tested.
  std::shared_ptr<KELAppEntry> cached(std::vector<platform::PropertyListDictionary::Entry> fields) {
    return KELAppEntry::initFromCacheRepresentation(system.platform, dictionary(std::move(fields)), path);
  }

  std::shared_ptr<KELAppEntry> entryAt(const std::string& bundlePath) {
    return KELAppEntry::initWithBundlePath(system.platform, bundlePath);
  }

  InMemoryPlatform system;
  const std::string path = "/Applications/Démo.app";
};

}  // namespace kel::test
