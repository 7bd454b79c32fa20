#include "platform/linux/files/files.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <fcntl.h>
#include <sys/random.h>

namespace kel::platform {

// `strerror` would speak the user's language, into a buffer that threads share.
std::string errorText(int errorNumber) {
  const char* text = strerrordesc_np(errorNumber);
  return text ? text : "Error " + std::to_string(errorNumber);
}

std::string errorLine(const std::string& path, int errorNumber) {
  return path + ": " + errorText(errorNumber);
}

bool isTransient(int errorNumber) {
  constexpr std::array answers{ENOENT, ENOTDIR, EACCES, EPERM, ELOOP, ENAMETOOLONG,
                               EISDIR, EINVAL,  EFBIG,  ENXIO, ENODEV};
  return std::ranges::find(answers, errorNumber) == answers.end();
}

bool isWhole(const std::string& path) {
  if (path.find('\0') == std::string::npos) return true;
  errno = EINVAL;
  return false;
}

OwnedDescriptor openFile(int directory, const std::string& path, int flags, mode_t mode) {
  if (!isWhole(path)) return {};
  for (;;) {
    OwnedDescriptor file(openat(directory, path.c_str(), flags | O_CLOEXEC, mode));
    if (file || errno != EINTR) return file;
  }
}

bool writeWhole(int descriptor, BytesView bytes) {
  while (!bytes.empty()) {
    const ssize_t written = write(descriptor, bytes.data(), bytes.size());
    if (written < 0 && errno == EINTR) continue;
    // Should not happen, but trying again without end would be worse than a wrong reason.
    if (written == 0) errno = ENOSPC;
    if (written <= 0) return false;
    bytes = bytes.subspan(static_cast<std::size_t>(written));
  }
  return true;
}

bool isRegularFile(int descriptor, struct stat& status) {
  if (fstat(descriptor, &status) != 0) return false;
  if (S_ISREG(status.st_mode)) return true;
  errno = S_ISDIR(status.st_mode) ? EISDIR : EINVAL;
  return false;
}

std::optional<Bytes> readFile(int directory, const std::string& path, std::size_t largest) {
  // A FIFO without a writer would keep us in `open`; a terminal would become the one that controls this
  // process.
  const OwnedDescriptor file = openFile(directory, path, O_RDONLY | O_NONBLOCK | O_NOCTTY);
  struct stat status {};
  if (!file || !isRegularFile(file.get(), status)) return std::nullopt;
  const auto size = static_cast<std::size_t>(status.st_size);
  std::size_t length = 0;
  // What states no size is the system's, and some of that is given in one piece or not at all.
  constexpr std::size_t piece = 4096;
  // One byte more than wanted, which shows that the file is longer than it said, or than is allowed.
  Bytes bytes(std::min(size > 0 ? size : piece, largest) + 1);
  while (size <= largest && length <= largest) {
    const ssize_t count = read(file.get(), bytes.data() + length, bytes.size() - length);
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return std::nullopt;
    length += static_cast<std::size_t>(count);
    // Stopping at the stated size spares the call that would only say that this was the end.
    if (count == 0 || (length == size && length < bytes.size() && size > 0)) {
      bytes.resize(length);
      return bytes;
    }
    if (length == bytes.size()) bytes.resize(std::min(largest + 1, length * 2 + 4096));
  }
  errno = EFBIG;
  return std::nullopt;
}

std::optional<std::string> readSmallFile(int directory, const std::string& path, std::size_t largest) {
  const auto bytes = readFile(directory, path, largest);
  return bytes ? std::optional(std::string(bytes->begin(), bytes->end())) : std::nullopt;
}

DirectoryListing openListing(const std::string& path) {
  return DirectoryListing(isWhole(path) ? opendir(path.c_str()) : nullptr);
}

bool makeDirectories(const std::string& path) {
  if (!isWhole(path)) return false;
  if (isDirectory(path)) return true;
  for (std::size_t end = path.find('/', 1); end != std::string::npos; end = path.find('/', end + 1)) {
    // Somebody else may be making the same path at the same time.
    if (mkdir(path.substr(0, end).c_str(), 0700) != 0 && errno != EEXIST) return false;
  }
  if (mkdir(path.c_str(), 0700) == 0 || isDirectory(path)) return true;
  if (errno == EEXIST) errno = ENOTDIR;
  return false;
}

bool isDirectory(const std::string& path) {
  struct stat status {};
  // Also asked between a failure and the report of its reason.
  const int kept = errno;
  const bool found = isWhole(path) && stat(path.c_str(), &status) == 0 && S_ISDIR(status.st_mode);
  errno = kept;
  return found;
}

std::uint64_t randomNumber() {
  std::uint64_t number = 0;
  ssize_t got = 0;
  do {
    got = getrandom(&number, sizeof number, 0);
  } while (got < 0 && errno == EINTR);
  if (got == sizeof number) return number;
  const auto now = std::chrono::steady_clock::now().time_since_epoch().count();
  return static_cast<std::uint64_t>(now) ^ static_cast<std::uint64_t>(getpid()) << 40;
}

}  // namespace kel::platform
