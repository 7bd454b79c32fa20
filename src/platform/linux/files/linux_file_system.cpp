#include "platform/linux/files/linux_file_system.h"

#include <algorithm>
#include <cerrno>
#include <fcntl.h>
#include <stdio.h>
#include <string_view>
#include <unistd.h>

#include "platform/linux/files/files.h"
#include "property_lists/unicode.h"

namespace kel::platform {

namespace {

/// A file under a name of its own that becomes the one wanted by `replace`, or vanishes. It lies in the same
/// directory, since a rename does not lead from one file system to another.
class TemporaryFile {
 public:
  TemporaryFile(int directory, std::string_view wanted) : directory_(directory), wanted_(wanted) {
    constexpr std::size_t longestStem = 200;  // leaves room below the longest name that a directory takes
    constexpr int attempts = 16;
    for (int attempt = 0; attempt < attempts; ++attempt) {
      name_ = '.';
      name_.append(wanted_, 0, longestStem).append(1, '.').append(std::to_string(randomNumber()));
      file_ = openFile(directory_, name_, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW, 0600);
      if (file_ || errno != EEXIST) break;
    }
    if (!file_) name_.clear();
  }

  TemporaryFile(const TemporaryFile&) = delete;
  TemporaryFile& operator=(const TemporaryFile&) = delete;

  ~TemporaryFile() {
    if (name_.empty()) return;
    const int kept = errno;
    unlinkat(directory_, name_.c_str(), 0);
    errno = kept;
  }

  bool replace(BytesView bytes) {
    // Flushed before it is renamed: else the name may reach the disk before the contents, and a machine that
    // loses power in between comes back with an empty file in place of the old one.
    if (!file_ || !writeWhole(file_.get(), bytes) || fsync(file_.get()) != 0) return false;
    file_.reset();
    if (renameat(directory_, name_.c_str(), directory_, wanted_.c_str()) != 0) return false;
    name_.clear();
    return true;
  }

 private:
  int directory_;
  std::string wanted_;
  std::string name_;  // empty when there is nothing to remove
  OwnedDescriptor file_;
};

}  // namespace

DirectoryReading LinuxFileSystem::listDirectory(const std::string& directory) {
  const auto failed = [&directory](int error) {
    return DirectoryReading{std::nullopt, errorLine(directory, error), isTransient(error)};
  };
  const DirectoryListing listing = openListing(directory);
  if (!listing) return failed(errno);
  std::vector<std::string> names;
  std::size_t unreadable = 0;
  for (;;) {
    // The end of the list and a failure differ in nothing but this.
    errno = 0;
    const dirent* entry = readdir(listing.get());
    if (!entry && errno != 0) return failed(errno);
    if (!entry) break;
    const std::string_view name(entry->d_name);
    if (name == "." || name == "..") continue;
    if (isValidUTF8(name)) {
      names.emplace_back(name);
    } else {
      ++unreadable;
    }
  }
  if (unreadable > 0) {
    log_.write(directory + ": left out " + std::to_string(unreadable) + " name(s) that are not UTF-8");
  }
  return {std::move(names), {}, false};
}

bool LinuxFileSystem::exists(const std::string& path) {
  struct stat status {};
  return isWhole(path) && stat(path.c_str(), &status) == 0;
}

FileReading LinuxFileSystem::read(const std::string& path, std::size_t largest) {
  auto bytes = readFile(AT_FDCWD, path, largest);
  const int error = errno;
  if (bytes) return {std::move(bytes), {}, false};
  return {std::nullopt, error == EINVAL ? path + ": not a regular file" : errorLine(path, error),
          isTransient(error)};
}

std::optional<std::string> LinuxFileSystem::writeAtomically(const std::string& path, BytesView bytes) {
  const std::size_t slash = path.rfind('/');
  const std::string parent =
      slash == std::string::npos ? "." : path.substr(0, std::max<std::size_t>(slash, 1));
  if (!isWhole(path) || slash + 1 == path.size()) return errorLine(path, EINVAL);
  if (!makeDirectories(parent)) return errorLine(parent, errno);
  const OwnedDescriptor directory = openFile(AT_FDCWD, parent, O_RDONLY | O_DIRECTORY);
  if (!directory) return errorLine(parent, errno);
  TemporaryFile temporary(directory.get(), std::string_view(path).substr(slash + 1));
  if (!temporary.replace(bytes)) return errorLine(path, errno);
  // Some file systems have no flushing of directories and say EINVAL.
  if (fsync(directory.get()) != 0 && errno != EINVAL) return errorLine(parent, errno);
  return std::nullopt;
}

std::optional<std::string> LinuxFileSystem::writePlainly(const std::string& path, BytesView bytes) {
  // A FIFO that nobody reads would keep a blocking open waiting; this one fails.
  const OwnedDescriptor file =
      openFile(AT_FDCWD, path, O_WRONLY | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY, 0600);
  struct stat status {};
  // Cut only now that it is known what was opened.
  if (!file || !isRegularFile(file.get(), status) || ftruncate(file.get(), 0) != 0 ||
      !writeWhole(file.get(), bytes) || fsync(file.get()) != 0) {
    return errorLine(path, errno);
  }
  return std::nullopt;
}

bool LinuxFileSystem::remove(const std::string& path) { return isWhole(path) && unlink(path.c_str()) == 0; }

}  // namespace kel::platform
