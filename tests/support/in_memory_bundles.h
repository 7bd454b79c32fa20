#pragma once

#include <atomic>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/bundles.h"
#include "support/in_memory_files.h"

namespace kel::test {

class InMemoryBundle : public platform::Bundle {
 public:
  InMemoryBundle(InMemoryFileSystem& files, std::string path) : files_(files), path_(std::move(path)) {}

  platform::InformationReading information() override {
    if (!information_) {
      const platform::DictionaryReading reading =
          platform::readDictionaryFile(files_, platform::joinPath(path_, "Info.plist"),
                                       platform::largestForeignFile, platform::bundleFileLimits);
      information_ =
          platform::InformationReading{reading.dictionary.value_or(platform::PropertyListDictionary()),
                                       reading.isTransient ? reading.error : ""};
    }
    return *information_;
  }
  std::optional<platform::PropertyListValue> identifier() override {
    return platform::bundleIdentifier(information().dictionary);
  }
  std::optional<std::string> resourcePath(std::string_view name, std::string_view type,
                                          std::string_view localization) override {
    const auto resource = platform::localizedResourceName(name, type, localization);
    const std::string path = platform::joinPath(path_, resource.value_or(""));
    return resource && files_.exists(path) && files_.isFile(path) ? std::optional(path) : std::nullopt;
  }

 private:
  InMemoryFileSystem& files_;
  const std::string path_;
  std::optional<platform::InformationReading> information_;
};

/// The bundles of an in-memory file system: a bundle is a directory with an "Info.plist" and a "Resources"
/// directory. Borrows the file system. Any thread.
class InMemoryBundles : public platform::Bundles {
 public:
  explicit InMemoryBundles(InMemoryFileSystem& files) : files_(files) {}

  std::unique_ptr<platform::Bundle> open(const std::string& path) override {
    ++opens;
    return files_.isDirectory(path) ? std::make_unique<InMemoryBundle>(files_, path) : nullptr;
  }

  std::atomic<int> opens = 0;  ///< how often a bundle was asked for, successfully or not

 private:
  InMemoryFileSystem& files_;
};

/// Puts a bundle with this information dictionary at `path`.
inline void addBundle(InMemoryFileSystem& files, const std::string& path,
                      const platform::PropertyListDictionary& informationDictionary) {
  files.addPropertyList(platform::joinPath(path, "Info.plist"), informationDictionary);
}

/// Gives the bundle at `path` a menu strings file for `localization`.
inline void addMenuStrings(InMemoryFileSystem& files, const std::string& path,
                           const std::string& localization, const platform::PropertyListValue& table) {
  files.addPropertyList(platform::joinPath(path, "Resources/" + localization + "/ServicesMenu.strings"),
                        table);
}

}  // namespace kel::test
