#include "platform/linux/journal/entry_look.h"

#include <array>
#include <cerrno>
#include <climits>
#include <ctime>
#include <fcntl.h>
#include <optional>
#include <sys/stat.h>
#include <sys/sysmacros.h>

#include "platform/linux/files/files.h"

namespace kel::platform {

namespace {

constexpr std::int64_t nanosecondsPerSecond = 1'000'000'000;

EntryKind kindOf(mode_t mode) {
  if (S_ISREG(mode)) return EntryKind::File;
  if (S_ISDIR(mode)) return EntryKind::Directory;
  return S_ISLNK(mode) ? EntryKind::Link : EntryKind::Other;
}

EntryStatus look(int directory, const char* name, int flags, std::uint64_t* device = nullptr) {
  struct statx found {};
  constexpr unsigned wanted = STATX_TYPE | STATX_NLINK | STATX_INO | STATX_CTIME | STATX_MTIME | STATX_SIZE;
  EntryStatus status;
  if (statx(directory, name, flags | AT_NO_AUTOMOUNT, wanted, &found) != 0) {
    status.size = static_cast<std::uint64_t>(errno);
    return status;
  }
  const auto nanoseconds = [](const statx_timestamp& time) {
    // Wraps around in the far future, which anyone may give a file.
    return static_cast<std::int64_t>(static_cast<std::uint64_t>(time.tv_sec) * nanosecondsPerSecond +
                                     time.tv_nsec);
  };
  status.kind = kindOf(found.stx_mode);
  status.hasOtherNames = status.kind == EntryKind::File && found.stx_nlink > 1;
  status.inode = found.stx_ino;
  status.changed = nanoseconds(found.stx_ctime);
  status.modified = nanoseconds(found.stx_mtime);
  status.size = found.stx_size;
  if (device) *device = makedev(found.stx_dev_major, found.stx_dev_minor);
  return status;
}

/// Link text and contents; absent when there is too much of them, or they cannot be read.
std::optional<Digest> digestOf(int directory, const char* name, const EntryRecord& record) {
  constexpr std::size_t largest = 1024 * 1024;
  Bytes bytes;
  if (record.isLink()) {
    std::array<char, PATH_MAX> text;
    const ssize_t length = readlinkat(directory, name, text.data(), text.size());
    if (length < 0) return std::nullopt;
    bytes.assign(text.begin(), text.begin() + length);
    bytes.push_back(0);
  }
  if ((record.isLink() ? record.target : record.status).kind == EntryKind::File) {
    const auto contents = readFile(directory, name, largest);
    if (!contents) return std::nullopt;
    bytes.insert(bytes.end(), contents->begin(), contents->end());
  }
  return md5(bytes);
}

}  // namespace

EntryRecord lookAtEntry(int directory, const char* name) {
  EntryRecord record;
  record.isKnown = true;
  record.status = look(directory, name, AT_SYMLINK_NOFOLLOW);
  if (record.isLink()) record.target = look(directory, name, 0);
  // Its times change with its names, which are looked at when it is listed.
  for (EntryStatus* status : {&record.status, &record.target}) {
    if (status->kind == EntryKind::Directory) *status = {EntryKind::Directory, false, status->inode, 0, 0, 0};
  }
  return record;
}

std::int64_t timeStampNow() {
  timespec now{};
  clock_gettime(CLOCK_REALTIME_COARSE, &now);
  return static_cast<std::int64_t>(now.tv_sec) * nanosecondsPerSecond + now.tv_nsec;
}

EntryRecord takeRecord(int directory, const char* name, const EntryRecord* before,
                       const RecordTaking& taking) {
  constexpr int attempts = 3;
  EntryRecord record = lookAtEntry(directory, name);
  for (int attempt = 0; attempt < attempts; ++attempt) {
    // A link may lead to another file system, whose clock nobody here knows.
    const TimeStamps stamps = record.isLink() ? TimeStamps::Foreign : taking.stamps;
    const auto racy = [&taking, stamps](const EntryStatus& status) {
      return status.kind != EntryKind::Unknown && status.kind != EntryKind::Directory &&
             isRacy(status.changed, taking.now, stamps);
    };
    record.isRacy = racy(record.status) || racy(record.target);
    const bool isWanted = record.isRacy && (taking.digestIfRacy || changesUnseen(record));
    if (!isWanted && !(before && before->digest)) return record;
    if (std::chrono::steady_clock::now() > taking.deadline) return record;
    record.digest = digestOf(directory, name, record);
    // Only when nothing changed around the reading do the two belong together.
    const EntryRecord after = lookAtEntry(directory, name);
    if (after.status == record.status && after.target == record.target) return record;
    record = after;
  }
  record.isRacy = true;
  return record;
}

EntryStatus statusOf(int descriptor, std::uint64_t& device) {
  return look(descriptor, "", AT_EMPTY_PATH, &device);
}

}  // namespace kel::platform
