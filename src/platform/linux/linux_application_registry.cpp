#include "platform/linux/linux_application_registry.h"

#include <algorithm>
#include <fcntl.h>
#include <string_view>

#include "platform/linux/files.h"
#include "platform/unicode.h"

namespace kel::platform {

namespace {

/// Walks one application directory. Recursion ends at the depth limit, the whole walk at the folder limit.
class ApplicationScan {
 public:
  void walk(const std::string& folder, int depth = 0) {
    constexpr int deepest = 16;
    constexpr std::size_t mostFolders = 50'000;
    if (depth > deepest || ++folders_ > mostFolders) {
      incomplete_ = true;
      return;
    }
    for (const std::string& subfolder : list(folder, depth)) walk(subfolder, depth + 1);
  }

  std::vector<std::string> takeApplications() {
    std::sort(applications_.begin(), applications_.end());
    return std::move(applications_);
  }

  /// True when a limit cut the walk short.
  bool incomplete() const { return incomplete_; }

 private:
  /// Notes the applications in `folder` and returns its plain subfolders: none when it is itself a bundle.
  std::vector<std::string> list(const std::string& folder, int depth) {
    const DirectoryListing listing = openListing(folder);
    std::vector<std::string> found;
    std::vector<std::string> subfolders;
    while (const dirent* entry = listing ? readdir(listing.get()) : nullptr) {
      const std::string_view name(entry->d_name);
      if (name.starts_with('.') || !isValidUTF8(name)) continue;
      if (depth > 0 && name == "Info.plist") return {};
      const bool isApplication = name.ends_with(".app");
      if (!isDirectoryEntry(dirfd(listing.get()), *entry, isApplication)) continue;
      (isApplication ? found : subfolders).push_back(joinPath(folder, name));
    }
    std::move(found.begin(), found.end(), std::back_inserter(applications_));
    return subfolders;
  }

  static bool isDirectoryEntry(int folder, const dirent& entry, bool followLink) {
    if (entry.d_type == DT_DIR) return true;
    if (entry.d_type != DT_UNKNOWN && !(entry.d_type == DT_LNK && followLink)) return false;
    struct stat status {};
    return fstatat(folder, entry.d_name, &status, followLink ? 0 : AT_SYMLINK_NOFOLLOW) == 0 &&
           S_ISDIR(status.st_mode);
  }

  std::vector<std::string> applications_;
  std::size_t folders_ = 0;
  bool incomplete_ = false;
};

}  // namespace

std::vector<std::string> LinuxApplicationRegistry::applicationDirectories(const std::string& home) {
  return {"/System/Applications/", "/Network/Applications/", "/Applications/",
          joinPath(home, "Applications/")};
}

std::vector<RegisteredApplication> LinuxApplicationRegistry::applications(std::uint32_t mask,
                                                                          std::uint32_t value) {
  const std::vector<std::string> paths = findApplications();
  std::vector<std::uint32_t> flags(paths.size());
  queue_.apply(paths.size(), [&](std::size_t index) { flags[index] = informationFlags(paths[index]); });
  std::vector<RegisteredApplication> result;
  for (std::size_t index = 0; index < paths.size(); ++index) {
    if ((flags[index] & mask) == value) result.push_back({paths[index]});
  }
  return result;
}

std::vector<std::string> LinuxApplicationRegistry::findApplications() {
  std::vector<std::string> paths;
  for (const std::string& root : roots_) {
    ApplicationScan scan;
    scan.walk(root);
    if (scan.incomplete())
      log_.write("Too many or too deep folders in " + root + ": applications may be missing");
    std::ranges::move(scan.takeApplications(), std::back_inserter(paths));
  }
  return paths;
}

std::uint32_t LinuxApplicationRegistry::informationFlags(const std::string& application) {
  const std::string path = joinPath(application, "Info.plist");
  const DictionaryReading reading = readDictionaryFile(files_, path, largestForeignFile, bundleFileLimits);
  const PropertyListValue* services = reading.dictionary ? reading.dictionary->find("QVServices") : nullptr;
  const PropertyListArray* array = services ? services->asArray() : nullptr;
  return array && !array->empty() ? providesServices : 0;
}

}  // namespace kel::platform
