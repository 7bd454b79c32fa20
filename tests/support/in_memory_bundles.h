#pragma once

#include <cstddef>
#include <map>
#include <memory>
#include <string>

#include "platform/bundles.h"
#include "platform/guarded.h"
#include "support/in_memory_files.h"

namespace kel::test {

/// The bundles of an in-memory file system: a bundle is a directory with an "Info.plist" and a "Resources"
/// directory. Borrows the file system. Any thread.
class InMemoryBundles : public platform::Bundles {
 public:
  explicit InMemoryBundles(InMemoryFileSystem& files) : files_(files) {}

  std::unique_ptr<platform::Bundle> open(const std::string& path) override;

  /// How often the bundle at `path`, and any bundle, was asked for, successfully or not.
  std::size_t opens(const std::string& path) const;
  std::size_t opens() const;

 private:
  InMemoryFileSystem& files_;
  mutable platform::Guarded<std::map<std::string, std::size_t>> opens_;
};

/// Puts a bundle with this information dictionary at `path`.
void addBundle(InMemoryFileSystem& files, const std::string& path,
               const platform::PropertyListDictionary& informationDictionary);

/// Gives the bundle at `path` a menu strings file for `localization`.
void addMenuStrings(InMemoryFileSystem& files, const std::string& path, const std::string& localization,
                    const platform::PropertyListValue& table);

}  // namespace kel::test
