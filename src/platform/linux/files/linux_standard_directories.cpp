#include "platform/linux/files/linux_standard_directories.h"

#include <cerrno>
#include <fcntl.h>
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include "platform/file_system.h"
#include "platform/linux/files/files.h"
#include "platform/linux/files/runtime_directory.h"

namespace kel::platform {

namespace {

std::string withoutTrailingSlashes(std::string path) {
  while (path.size() > 1 && path.ends_with('/')) path.pop_back();
  return path;
}

std::optional<std::string> homeFromUserDatabase() {
  constexpr std::size_t largestRecord = 1 << 20;
  // How much room a record takes only the attempt tells.
  for (std::string buffer(4096, '\0'); buffer.size() <= largestRecord; buffer.resize(buffer.size() * 2)) {
    passwd record{};
    passwd* found = nullptr;
    const int error = getpwuid_r(getuid(), &record, buffer.data(), buffer.size(), &found);
    if (error == ERANGE) continue;
    if (error != 0 || !found || !found->pw_dir || found->pw_dir[0] != '/') return std::nullopt;
    return found->pw_dir;
  }
  return std::nullopt;
}

bool isSafeForTemporaryFiles(const std::string& path) {
  const OwnedDescriptor directory = openFile(AT_FDCWD, path, O_PATH | O_DIRECTORY);
  struct stat status {};
  if (!directory || fstat(directory.get(), &status) != 0 || status.st_uid != geteuid()) return false;
  // Where others may write the sticky bit keeps them from replacing what is ours.
  return (status.st_mode & (S_IWGRP | S_IWOTH)) == 0 || (status.st_mode & S_ISVTX) != 0;
}

}  // namespace

std::vector<std::string> LinuxStandardDirectories::libraryDirectories() {
  return {joinPath(homeDirectory(), "Library"), "/Library", "/Network/Library", "/System/Library"};
}

std::vector<std::string> LinuxStandardDirectories::systemLibraryDirectories() { return {"/System/Library"}; }

std::vector<std::string> LinuxStandardDirectories::cachesDirectories() {
  const auto caches = userDirectory("XDG_CACHE_HOME", ".cache");
  return caches ? std::vector{*caches} : std::vector<std::string>{};
}

std::optional<std::string> LinuxStandardDirectories::temporaryDirectory() {
  const auto wanted = absoluteVariable("TMPDIR");
  if (wanted && isSafeForTemporaryFiles(*wanted)) return wanted;
  return runtimeDirectory_ ? makePrivateDirectory(joinPath(*runtimeDirectory_, "tmp")).path : std::nullopt;
}

std::string LinuxStandardDirectories::homeDirectory() {
  if (auto home = absoluteVariable("HOME")) return *home;
  return withoutTrailingSlashes(homeFromUserDatabase().value_or("/"));
}

std::optional<std::string> LinuxStandardDirectories::stateDirectory() {
  return userDirectory("XDG_STATE_HOME", ".local/state");
}

std::optional<std::string> LinuxStandardDirectories::configurationDirectory() {
  return userDirectory("XDG_CONFIG_HOME", ".config");
}

std::optional<std::string> LinuxStandardDirectories::absoluteVariable(const std::string& name) {
  auto value = facts_.environmentVariable(name);
  if (!value || !value->starts_with('/')) return std::nullopt;
  return withoutTrailingSlashes(std::move(*value));
}

std::optional<std::string> LinuxStandardDirectories::userDirectory(const std::string& variable,
                                                                   std::string_view belowHome) {
  std::string path = absoluteVariable(variable).value_or(joinPath(homeDirectory(), belowHome));
  // Programs run for another user commonly keep the variables of the first one, whose files they must not
  // touch.
  struct stat status {};
  const bool exists = stat(path.c_str(), &status) == 0;
  if (exists && (!S_ISDIR(status.st_mode) || status.st_uid != geteuid())) return std::nullopt;
  return path;
}

}  // namespace kel::platform
