#include "platform/linux/process/process_confinement.h"

#include <algorithm>
#include <cerrno>
#include <fcntl.h>
#include <optional>
#include <poll.h>
#include <sys/stat.h>

#include "platform/linux/files/files.h"

// What counts as doubt. A sandboxed process must not have more done for it than it may do itself, so the
// answer "not sandboxed" needs every sign to be read and to be absent; what cannot be read says "sandboxed".
//
// The signs are those that a sandbox cannot take off from inside: a user namespace or a root directory other
// than ours (both compared by what the link in /proc leads to, not by its text), the information file that a
// runtime puts into the root, a control group named by a runtime's launcher, a security label other than ours
// that confines. That a security module is not there is no doubt: the kernel says so with ENOENT or EINVAL.
// That a file cannot be read for another reason is one, and so is our own label, when there is nothing to
// compare with.
//
// The process may end at any time and its id pass to another. All is read below one open directory of /proc,
// which stays that of the process it was opened for, but that may have been the other one already. Hence the
// last question, to the process descriptor of the connection: is the one that connected still there? Then the
// id was its own all the time. A process without descriptor is in doubt from the start.
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
