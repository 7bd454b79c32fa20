#include "platform/linux/files/runtime_directory.h"

#include <cerrno>
#include <cstdlib>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include "platform/linux/files/files.h"

namespace kel::platform {

RuntimeDirectory resolveRuntimeDirectory() {
  const char* session = std::getenv("XDG_RUNTIME_DIR");
  if (!session || session[0] != '/') return makePrivateDirectory("/tmp/kel-" + std::to_string(geteuid()));
  return makePrivateDirectory(std::string(session) + "/kel");
}

RuntimeDirectory makePrivateDirectory(const std::string& path) {
  const auto refused = [&path](const std::string& reason) {
    return RuntimeDirectory{std::nullopt, path + ": " + reason};
  };
  const auto failed = [&refused] { return refused(errorText(errno)); };

  if (mkdir(path.c_str(), 0700) == 0) {
    // The file-creation mask may have taken permissions away from the owner.
    if (chmod(path.c_str(), 0700) != 0) return failed();
  } else if (errno != EEXIST) {
    return failed();
  }
  // In /tmp anyone can make a directory of this name first. What is judged, and given its mode, is what was
  // opened, so that nothing can be exchanged in between.
  const OwnedDescriptor directory = openFile(AT_FDCWD, path, O_RDONLY | O_DIRECTORY | O_NOFOLLOW);
  struct stat status {};
  if (!directory || fstat(directory.get(), &status) != 0) return failed();
  if (status.st_uid != geteuid()) return refused("belongs to another user");
  if ((status.st_mode & (S_IWGRP | S_IWOTH)) != 0) return refused("others may write to it");
  if ((status.st_mode & 0777) != 0700 && fchmod(directory.get(), 0700) != 0) return failed();
  return {path, {}};
}

}  // namespace kel::platform
