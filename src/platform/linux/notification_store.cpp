#include "platform/linux/notification_store.h"

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <fcntl.h>
#include <stdio.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>

#include "platform/digest.h"
#include "platform/file_system.h"
#include "platform/linux/files.h"

namespace kel::platform {

namespace {

constexpr std::string_view mark = "KELSEED1";
constexpr std::size_t digestOffset = 24;
constexpr std::size_t recordSize = digestOffset + std::tuple_size_v<Digest>;

// Neither can be the file of a name: those never begin with a dot.
constexpr const char* lockName = ".lock";
constexpr const char* newRecordName = ".new";

void appendNumber(Bytes& bytes, std::uint64_t number) {
  for (int shift = 0; shift < 64; shift += 8) bytes.push_back(static_cast<std::uint8_t>(number >> shift));
}

std::uint64_t numberAt(BytesView bytes, std::size_t offset) {
  std::uint64_t number = 0;
  for (std::size_t i = 8; i-- > 0;) number = number << 8 | bytes[offset + i];
  return number;
}

OwnedDescriptor openDirectory(const std::string& path) {
  OwnedDescriptor directory = openFile(AT_FDCWD, path, O_RDONLY | O_DIRECTORY | O_NOFOLLOW);
  struct stat status {};
  if (!directory || fstat(directory.get(), &status) != 0) return {};
  if (status.st_uid == geteuid()) return directory;
  errno = EPERM;
  return {};
}

std::optional<NotificationRecord> readRecord(int directory, const std::string& file) {
  const auto text = readSmallFile(directory, file, recordSize);
  if (!text) return std::nullopt;
  const auto record =
      decodeNotificationRecord({reinterpret_cast<const std::uint8_t*>(text->data()), text->size()});
  if (!record) errno = EBADMSG;
  return record;
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
  return fresh && writeWhole(fresh.get(), encodeNotificationRecord(record)) &&
         renameat(directory, newRecordName, directory, file.c_str()) == 0;
}

}  // namespace

Bytes encodeNotificationRecord(const NotificationRecord& record) {
  Bytes bytes(mark.begin(), mark.end());
  appendNumber(bytes, record.state);
  appendNumber(bytes, record.posts);
  const Digest digest = md5(bytes);
  bytes.insert(bytes.end(), digest.begin(), digest.end());
  return bytes;
}

std::optional<NotificationRecord> decodeNotificationRecord(BytesView bytes) {
  if (bytes.size() != recordSize || !std::equal(mark.begin(), mark.end(), bytes.begin())) return std::nullopt;
  const Digest digest = md5(bytes.first(digestOffset));
  if (!std::equal(digest.begin(), digest.end(), bytes.begin() + digestOffset)) return std::nullopt;
  return NotificationRecord{numberAt(bytes, 8), numberAt(bytes, 16)};
}

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
