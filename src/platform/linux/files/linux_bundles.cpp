#include "platform/linux/files/linux_bundles.h"

#include <cerrno>
#include <sys/stat.h>

#include "platform/linux/files/files.h"

namespace kel::platform {

namespace {

class LinuxBundle final : public Bundle {
 public:
  LinuxBundle(FileSystem& files, SystemLog& log, std::string path)
      : files_(files), log_(log), path_(std::move(path)) {}

  InformationReading information() override {
    if (!information_) information_ = readInformation();
    return *information_;
  }

  std::optional<PropertyListValue> identifier() override {
    return bundleIdentifier(information().dictionary);
  }

  std::optional<std::string> resourcePath(std::string_view name, std::string_view type,
                                          std::string_view localization) override {
    // The localization comes from whoever asks: its name must not lead out of the bundle.
    const auto below = localizedResourceName(name, type, localization);
    if (!below) return std::nullopt;
    std::string path = joinPath(path_, *below);
    struct stat status {};
    if (stat(path.c_str(), &status) == 0 ? S_ISREG(status.st_mode) : isTransient(errno)) return path;
    return std::nullopt;
  }

 private:
  InformationReading readInformation() {
    const std::string path = joinPath(path_, "Info.plist");
    DictionaryReading reading = readDictionaryFile(files_, path, largestForeignFile, bundleFileLimits);
    if (reading.dictionary) return {std::move(*reading.dictionary), {}};
    if (reading.isTransient) return {{}, std::move(reading.error)};
    // A directory without one is no bundle, which is common and worth no line.
    if (files_.exists(path))
      log_.write("Cannot read the information dictionary " + path + ": " + reading.error);
    return {};
  }

  FileSystem& files_;
  SystemLog& log_;
  const std::string path_;
  std::optional<InformationReading> information_;
};

}  // namespace

std::unique_ptr<Bundle> LinuxBundles::open(const std::string& path) {
  struct stat status {};
  const bool mayBeBundle =
      isWhole(path) && (stat(path.c_str(), &status) == 0 ? S_ISDIR(status.st_mode) : isTransient(errno));
  return mayBeBundle ? std::make_unique<LinuxBundle>(files_, log_, path) : nullptr;
}

}  // namespace kel::platform
