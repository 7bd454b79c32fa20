#include "platform/linux/notifications/notification_store.h"

#include <cerrno>
#include <chrono>
#include <fcntl.h>
#include <stdio.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>

#include "platform/file_system.h"
#include "platform/linux/files/files.h"
#include "platform/linux/files/sealed_bytes.h"

// A record is changed in four steps: take the lock, read the record, write the changed one as ".new", rename
// it over the old. Whoever reads takes no lock: it opens the file before or after the rename and has one
// record or the other, whole.
//
// The lock is one file for all names, held by `flock`. The kernel lets go of it when its holder dies, so
// there is no stale one to judge. It is never removed: who had it open would hold the lock of a file that
// others no longer find. It is tried again and again rather than waited for, because a holder that was
// stopped would stop every program of the user. ".new" is written under the lock only, so one name does, and
// what a crash left there is cut to nothing by the next.
//
// Everything is reached below one open directory, checked to be the user's after it was opened: one that is
// put in its place meanwhile is not written to. Nothing is flushed to the disk, because records end with the
// session.
//
// Never happens: a post that is lost to another one at the same time; a count that comes again, since a name
// without a record starts from the clock. A record that cannot be read counts as never set, and the next
// change replaces it.
namespace kel::platform {

namespace {

constexpr std::string_view recordFormat = "kel notification 1";
constexpr std::size_t largestRecord = 64;

// Neither can be the file of a name: those never begin with a dot.
constexpr const char* lockName = ".lock";
constexpr const char* newRecordName = ".new";

OwnedDescriptor openDirectory(const std::string& path) {
  OwnedDescriptor directory = openFile(AT_FDCWD, path, O_RDONLY | O_DIRECTORY | O_NOFOLLOW);
  struct stat status {};
  if (!directory || fstat(directory.get(), &status) != 0) return {};
  if (status.st_uid == geteuid()) return directory;
  errno = EPERM;
  return {};
}

std::optional<NotificationRecord> readRecord(int directory, const std::string& file) {
  const auto bytes = readFile(directory, file, largestRecord);
  if (!bytes) return std::nullopt;
  auto reader = ByteReader::open(*bytes, recordFormat);
  NotificationRecord record;
  if (reader) record = {reader->fixed(), reader->fixed()};
  if (reader && reader->atEnd()) return record;
  errno = EBADMSG;
  return std::nullopt;
}

/// Holders keep the lock for microseconds; one that does not let go must not stop the caller.
bool lockInTime(int lock) {
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(2);
  while (flock(lock, LOCK_EX | LOCK_NB) != 0) {
    const int error = errno;
    if ((error != EWOULDBLOCK && error != EINTR) || std::chrono::steady_clock::now() > deadline) {
      errno = error;
      return false;
    }
    std::this_thread::sleep_for(std::chrono::microseconds(100));
  }
  return true;
}

bool replaceRecord(int directory, const std::string& file, const NotificationRecord& record) {
  const OwnedDescriptor fresh =
      openFile(directory, newRecordName, O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_NONBLOCK, 0600);
  ByteWriter writer;
  writer.fixed(record.state);
  writer.fixed(record.posts);
  return fresh && writeWhole(fresh.get(), writer.sealed(recordFormat)) &&
         renameat(directory, newRecordName, directory, file.c_str()) == 0;
}

}  // namespace

std::optional<std::string> notificationFileName(std::string_view name) {
  constexpr std::size_t longest = 200;
  constexpr std::string_view plain = "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789_-.";
  constexpr std::string_view digits = "0123456789ABCDEF";
  std::string file;
  for (const char character : name) {
    if (plain.find(character) != std::string_view::npos && !(character == '.' && file.empty())) {
      file += character;
    } else {
      const auto byte = static_cast<unsigned char>(character);
      file.append({'%', digits[byte >> 4], digits[byte & 15]});
    }
    if (file.size() > longest) return std::nullopt;
  }
  return file.empty() ? std::nullopt : std::optional(file);
}

std::optional<NotificationRecord> NotificationStore::read(const std::string& name, std::string* error) const {
  const auto file = notificationFileName(name);
  if (!file) errno = ENAMETOOLONG;
  const OwnedDescriptor directory = file ? openDirectory(directory_) : OwnedDescriptor();
  auto record = directory ? readRecord(directory.get(), *file) : std::nullopt;
  if (!record && error && errno != ENOENT)
    *error = errorLine(joinPath(directory_, file.value_or(name)), errno);
  return record;
}

std::optional<std::string> NotificationStore::update(
    const std::string& name, const std::function<void(NotificationRecord&)>& change) const {
  const auto file = notificationFileName(name);
  if (!file) return errorLine(name, ENAMETOOLONG);
  if (!prepareDirectory()) return errorLine(directory_, errno);
  const OwnedDescriptor directory = openDirectory(directory_);
  if (!directory) return errorLine(directory_, errno);
  const OwnedDescriptor lock =
      openFile(directory.get(), lockName, O_RDWR | O_CREAT | O_NOFOLLOW | O_NONBLOCK, 0600);
  if (!lock || !lockInTime(lock.get())) return errorLine(joinPath(directory_, lockName), errno);
  NotificationRecord record = readRecord(directory.get(), *file).value_or(NotificationRecord());
  change(record);
  if (!replaceRecord(directory.get(), *file, record)) return errorLine(joinPath(directory_, *file), errno);
  return std::nullopt;
}

bool NotificationStore::prepareDirectory() const {
  if (mkdir(directory_.c_str(), 0700) != 0 && errno != EEXIST) return false;
  return static_cast<bool>(openDirectory(directory_));
}

}  // namespace kel::platform
