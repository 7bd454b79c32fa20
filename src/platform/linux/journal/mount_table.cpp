#include "platform/linux/journal/mount_table.h"

#include <cstdlib>
#include <fcntl.h>
#include <memory>

#include "platform/linux/files/files.h"
#include "platform/linux/journal/mount_lines.h"

namespace kel::platform {

namespace {

constexpr const char* tablePath = "/proc/self/mountinfo";

/// Where the path leads once its links are followed, without a trailing "/"; itself when it leads nowhere.
std::string resolved(const std::string& path) {
  const std::unique_ptr<char, decltype(&std::free)> real(realpath(path.c_str(), nullptr), &std::free);
  std::string result = real ? real.get() : path;
  while (result.size() > 1 && result.ends_with('/')) result.pop_back();
  return result;
}

}  // namespace

MountTable::MountTable(std::vector<std::string> paths)
    : paths_(std::move(paths)), table_(openFile(AT_FDCWD, tablePath, O_RDONLY)), mounts_(relevantMounts()) {}

bool MountTable::hasChanged() {
  std::vector<std::string> mounts = relevantMounts();
  const bool changed = mounts != mounts_ || mounts.empty();
  mounts_ = std::move(mounts);
  return changed;
}

std::vector<std::string> MountTable::relevantMounts() const {
  constexpr std::size_t largest = 16 * 1024 * 1024;
  std::vector<std::string> directories;
  for (const std::string& path : paths_) directories.push_back(resolved(path));
  return mountsAround(directories, readSmallFile(AT_FDCWD, tablePath, largest).value_or(""));
}

}  // namespace kel::platform
