#include "support/in_memory_bundles.h"

#include <numeric>
#include <utility>

namespace kel::test {

namespace {

class InMemoryBundle : public platform::Bundle {
 public:
  InMemoryBundle(InMemoryFileSystem& files, std::string path) : files_(files), path_(std::move(path)) {}

  platform::PropertyListDictionary informationDictionary() override {
    if (!information_) {
      information_ = platform::readDictionaryFile(files_, platform::joinPath(path_, "Info.plist"),
                                                  platform::largestForeignFile, platform::bundleFileLimits)
                         .dictionary.value_or(platform::PropertyListDictionary());
    }
    return *information_;
  }

  std::optional<platform::PropertyListValue> identifier() override {
    return platform::bundleIdentifier(informationDictionary());
  }

  std::optional<std::string> resourcePath(std::string_view name, std::string_view type,
                                          std::string_view localization) override {
    const std::optional<std::string> resource = platform::localizedResourceName(name, type, localization);
    if (!resource) return std::nullopt;
    std::string path = platform::joinPath(path_, *resource);
    if (!files_.exists(path)) return std::nullopt;
    return path;
  }

 private:
  InMemoryFileSystem& files_;
  const std::string path_;
  std::optional<platform::PropertyListDictionary> information_;
};

}  // namespace

std::unique_ptr<platform::Bundle> InMemoryBundles::open(const std::string& path) {
  opens_.with([&](auto& opens) { ++opens[path]; });
  if (!files_.isDirectory(path)) return nullptr;
  return std::make_unique<InMemoryBundle>(files_, path);
}

std::size_t InMemoryBundles::opens(const std::string& path) const {
  return opens_.with([&](const auto& opens) {
    const auto found = opens.find(path);
    return found == opens.end() ? 0 : found->second;
  });
}

std::size_t InMemoryBundles::opens() const {
  return opens_.with([](const auto& opens) {
    return std::accumulate(opens.begin(), opens.end(), std::size_t{0},
                           [](std::size_t sum, const auto& entry) { return sum + entry.second; });
  });
}

void addBundle(InMemoryFileSystem& files, const std::string& path,
               const platform::PropertyListDictionary& informationDictionary) {
  files.addPropertyList(platform::joinPath(path, "Info.plist"), informationDictionary);
}

void addMenuStrings(InMemoryFileSystem& files, const std::string& path, const std::string& localization,
                    const platform::PropertyListValue& table) {
  files.addPropertyList(platform::joinPath(path, "Resources/" + localization + "/ServicesMenu.strings"),
                        table);
}

}  // namespace kel::test
