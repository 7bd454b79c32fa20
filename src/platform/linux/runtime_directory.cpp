#include "platform/linux/runtime_directory.h"

#include <cerrno>
#include <cstdlib>
#include <fcntl.h>
#include <sys/stat.h>
#include <system_error>
#include <unistd.h>

#include "platform/linux/owned_descriptor.h"

namespace kel::platform {

RuntimeDirectory resolveRuntimeDirectory() {
  const char* session = std::getenv("XDG_RUNTIME_DIR");
  if (!session || session[0] != '/') return makeRuntimeDirectory("/tmp/kel-" + std::to_string(geteuid()));
  return makeRuntimeDirectory(std::string(session) + "/kel");
}

RuntimeDirectory makeRuntimeDirectory(const std::string& path) {
  const auto refused = [&path](const std::string& reason) {
    return RuntimeDirectory{std::nullopt, path + ": " + reason};
  };
  const auto failed = [&refused] { return refused(std::generic_category().message(errno)); };

  if (mkdir(path.c_str(), 0700) == 0) {
    // The file-creation mask may have taken permissions away from the owner.
    if (chmod(path.c_str(), 0700) != 0) return failed();
  } else if (errno != EEXIST) {
    return failed();
  }
  const OwnedDescriptor directory(open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  struct stat status {};
  if (!directory || fstat(directory.get(), &status) != 0) return failed();
  if (status.st_uid != geteuid()) return refused("belongs to another user");
  if ((status.st_mode & (S_IWGRP | S_IWOTH)) != 0) return refused("others may write to it");
  if ((status.st_mode & 0777) != 0700 && fchmod(directory.get(), 0700) != 0) return failed();
  return {path, {}};
}

}  // namespace kel::platform
