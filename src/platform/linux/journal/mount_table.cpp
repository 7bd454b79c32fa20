#include "platform/linux/journal/mount_table.h"

#include <algorithm>
#include <array>
#include <cstdlib>
#include <fcntl.h>
#include <memory>
#include <string_view>

#include "platform/linux/files/files.h"

namespace kel::platform {

namespace {

constexpr const char* tablePath = "/proc/self/mountinfo";

/// The table writes blanks, line ends and backslashes as three octal digits.
std::string unescaped(std::string_view text) {
  std::string result;
  for (std::size_t at = 0; at < text.size(); ++at) {
    const std::string_view digits = text.substr(at + 1, 3);
    if (text[at] == '\\' && digits.size() == 3 && digits.find_first_not_of("01234567") == digits.npos) {
      result.push_back(static_cast<char>((digits[0] - '0') * 64 + (digits[1] - '0') * 8 + (digits[2] - '0')));
      at += 3;
    } else {
      result.push_back(text[at]);
    }
  }
  return result;
}

/// The field of that number, from 0, of a line of the table.
std::string_view field(std::string_view line, int number) {
  for (; number > 0; --number) line.remove_prefix(std::min(line.find(' ') + 1, line.size()));
  return line.substr(0, line.find(' '));
}

bool contains(std::string_view directory, std::string_view path) {
  return path.starts_with(directory) &&
         (directory.ends_with('/') || path.size() == directory.size() || path[directory.size()] == '/');
}

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
  const std::string table = readSmallFile(AT_FDCWD, tablePath, largest).value_or("");
  std::vector<std::string> mounts;
  for (std::size_t at = 0; at < table.size();) {
    const std::size_t end = std::min(table.find('\n', at), table.size());
    const std::string_view line = std::string_view(table).substr(at, end - at);
    at = end + 1;
    const std::string point = unescaped(field(line, 4));
    if (std::any_of(directories.begin(), directories.end(), [&point](const std::string& directory) {
          return contains(point, directory) || contains(directory, point);
        })) {
      // Identity, device, directory of the device, mount point.
      mounts.push_back(std::string(field(line, 0))
                           .append(1, ' ')
                           .append(field(line, 2))
                           .append(1, ' ')
                           .append(field(line, 3)) +
                       " " + point);
    }
  }
  return mounts;
}

}  // namespace kel::platform
