#include "platform/linux/registry/application_walk.h"

#include <algorithm>
#include <cerrno>
#include <fcntl.h>
#include <string_view>
#include <utility>

#include "platform/file_system.h"
#include "platform/linux/files/files.h"
#include "property_lists/unicode.h"

namespace kel::platform {

namespace {

/// Recursion ends at the depth limit, the whole walk at the folder limit.
class Walker {
 public:
  void walk(const std::string& folder, int depth = 0) {
    constexpr int deepest = 16;
    constexpr std::size_t mostFolders = 50'000;
    if (depth > deepest || ++folders_ > mostFolders) {
      result_.reachedLimit = result_.incomplete = true;
      return;
    }
    for (const std::string& subfolder : list(folder, depth)) walk(subfolder, depth + 1);
  }

  ApplicationWalk takeResult() {
    std::ranges::sort(result_.applications, {}, &FoundApplication::path);
    return std::move(result_);
  }

 private:
  /// Notes the applications in `folder` and returns its plain subfolders: none when it is itself a bundle.
  std::vector<std::string> list(const std::string& folder, int depth) {
    const DirectoryListing listing = openListing(folder);
    std::vector<FoundApplication> found;
    std::vector<std::string> deadLinks;
    std::vector<std::string> subfolders;
    while (const dirent* entry = nextEntry(listing.get())) {
      const std::string_view name(entry->d_name);
      if (name.starts_with('.') || !isValidUTF8(name)) continue;
      if (depth > 0 && name == "Info.plist") return {};
      const bool isApplication = name.ends_with(".app");
      const mode_t type = typeOf(dirfd(listing.get()), *entry);
      if (type == S_IFDIR && !isApplication) subfolders.push_back(joinPath(folder, name));
      if (type == S_IFDIR && isApplication) found.push_back({joinPath(folder, name), false});
      if (type != S_IFLNK || !isApplication) continue;
      std::string path = joinPath(folder, name);
      if (isDirectory(path)) {
        found.push_back({std::move(path), true});
      } else {
        deadLinks.push_back(std::move(path));
      }
    }
    std::ranges::move(found, std::back_inserter(result_.applications));
    std::ranges::move(deadLinks, std::back_inserter(result_.deadLinks));
    return subfolders;
  }

  /// Null at the end. A root need not exist.
  const dirent* nextEntry(DIR* listing) {
    const bool isMissing = !listing && folders_ == 1 && (errno == ENOENT || errno == ENOTDIR);
    if (listing) errno = 0;
    const dirent* entry = listing ? readdir(listing) : nullptr;
    if (!entry && errno != 0 && !isMissing) {
      result_.incomplete = true;
      result_.isTransient = result_.isTransient || platform::isTransient(errno);
    }
    return entry;
  }

  static mode_t typeOf(int folder, const dirent& entry) {
    if (entry.d_type != DT_UNKNOWN) return static_cast<mode_t>(DTTOIF(entry.d_type));
    struct stat status {};
    return fstatat(folder, entry.d_name, &status, AT_SYMLINK_NOFOLLOW) == 0 ? status.st_mode & S_IFMT : 0;
  }

  ApplicationWalk result_;
  std::size_t folders_ = 0;
};

}  // namespace

ApplicationWalk walkApplications(const std::string& root) {
  Walker walker;
  walker.walk(root);
  return walker.takeResult();
}

}  // namespace kel::platform
