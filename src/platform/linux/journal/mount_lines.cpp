#include "platform/linux/journal/mount_lines.h"

#include <algorithm>

namespace kel::platform {

namespace {

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

/// The field of that number, from 0, of a line of the table; empty when the line ends before it.
std::string_view field(std::string_view line, int number) {
  for (; number > 0; --number) {
    const std::size_t blank = line.find(' ');
    if (blank == line.npos) return {};
    line.remove_prefix(blank + 1);
  }
  return line.substr(0, line.find(' '));
}

/// Whether `path` is `directory` or lies below it: a neighbour whose name begins alike does not.
bool contains(std::string_view directory, std::string_view path) {
  return path.starts_with(directory) &&
         (directory.ends_with('/') || path.size() == directory.size() || path[directory.size()] == '/');
}

}  // namespace

std::vector<std::string> mountsAround(const std::vector<std::string>& directories, std::string_view table) {
  std::vector<std::string> mounts;
  while (!table.empty()) {
    const std::size_t end = std::min(table.find('\n'), table.size());
    const std::string_view line = table.substr(0, end);
    table.remove_prefix(std::min(end + 1, table.size()));
    const std::string point = unescaped(field(line, 4));
    const bool matters = !point.starts_with('/') ||
                         std::any_of(directories.begin(), directories.end(), [&point](const auto& directory) {
                           return contains(point, directory) || contains(directory, point);
                         });
    if (!matters) continue;
    // Identity, device, directory of the device, mount point.
    std::string mount(field(line, 0));
    for (const std::string_view part : {field(line, 2), field(line, 3), std::string_view(point)}) {
      mount.append(1, ' ').append(part);
    }
    mounts.push_back(std::move(mount));
  }
  return mounts;
}

}  // namespace kel::platform
