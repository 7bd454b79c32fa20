#include "platform/linux/process/process_confinement.h"

#include <algorithm>
#include <cerrno>
#include <fcntl.h>
#include <optional>
#include <poll.h>
#include <sys/stat.h>

#include "platform/linux/files/files.h"

namespace kel::platform {

namespace {

enum class Presence { Present, Missing, Unknown };

Presence presence(int process, const char* path) {
  struct stat status {};
  if (fstatat(process, path, &status, AT_SYMLINK_NOFOLLOW) == 0) return Presence::Present;
  return errno == ENOENT ? Presence::Missing : Presence::Unknown;
}

/// Whether `path` below the two /proc directories leads to the same object (a namespace, a directory).
bool leadToTheSame(int process, int own, const char* path) {
  struct stat theirs {};
  struct stat ours {};
  return fstatat(process, path, &theirs, 0) == 0 && fstatat(own, path, &ours, 0) == 0 &&
         theirs.st_dev == ours.st_dev && theirs.st_ino == ours.st_ino;
}

/// The security label in `path`, empty when no security module gives one, absent when it cannot be told.
std::optional<std::string> label(int process, const char* path) {
  auto text = readSmallFile(process, path);
  if (!text) return errno == ENOENT || errno == EINVAL ? std::optional(std::string()) : std::nullopt;
  while (!text->empty() && (text->back() == '\n' || text->back() == '\0')) text->pop_back();
  return text;
}

bool hasConfiningLabel(int process, int own) {
  return std::ranges::any_of(std::initializer_list<const char*>{"attr/current", "attr/apparmor/current"},
                             [=](const char* path) {
                               const auto theirs = label(process, path);
                               const auto ours = label(own, path);
                               return !theirs || !ours || isConfiningLabel(*theirs, *ours);
                             });
}

bool isInSandboxScope(int process) {
  const auto controlGroups = readSmallFile(process, "cgroup");
  return !controlGroups || namesSandboxScope(*controlGroups);
}

/// The descriptor becomes readable when its process ends.
bool isAlive(int pidDescriptor) {
  pollfd ended{pidDescriptor, POLLIN, 0};
  return pidDescriptor >= 0 && poll(&ended, 1, 0) == 0;
}

}  // namespace

bool isSandboxed(pid_t pid, int pidDescriptor) {
  if (pid <= 0) return true;
  const OwnedDescriptor process = openFile(AT_FDCWD, "/proc/" + std::to_string(pid), O_PATH | O_DIRECTORY);
  const OwnedDescriptor own = openFile(AT_FDCWD, "/proc/self", O_PATH | O_DIRECTORY);
  if (!process || !own) return true;
  if (!leadToTheSame(process.get(), own.get(), "ns/user") ||
      !leadToTheSame(process.get(), own.get(), "root") ||
      presence(process.get(), "root/.flatpak-info") != Presence::Missing || isInSandboxScope(process.get()) ||
      hasConfiningLabel(process.get(), own.get())) {
    return true;
  }
  // Asked last: while the process lives its id cannot pass to another, so all answers were about it.
  return !isAlive(pidDescriptor);
}

bool namesSandboxScope(std::string_view controlGroups) {
  while (!controlGroups.empty()) {
    const std::size_t end = std::min(controlGroups.find_first_of("/\n"), controlGroups.size());
    const std::string_view name = controlGroups.substr(0, end);
    controlGroups.remove_prefix(std::min(end + 1, controlGroups.size()));
    const bool isScope = name.ends_with(".scope");
    if (isScope && (name.starts_with("flatpak-") || name.starts_with("app-flatpak-"))) return true;
    if ((isScope || name.ends_with(".service")) && name.starts_with("snap.")) return true;
  }
  return false;
}

bool isConfiningLabel(std::string_view label, std::string_view ownLabel) {
  return !label.empty() && label != ownLabel && label != "unconfined" && !label.ends_with(" (unconfined)") &&
         label.find(":unconfined_t:") == std::string_view::npos;
}

}  // namespace kel::platform
