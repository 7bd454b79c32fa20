#include "platform/linux/journal/entry_look.h"

#include <algorithm>
#include <cerrno>
#include <ctime>
#include <fcntl.h>
#include <linux/magic.h>
#include <sys/stat.h>
#include <sys/statfs.h>
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

std::int64_t nanoseconds(const statx_timestamp& time) {
  // Wraps around in the far future, which anyone may give a file.
  return static_cast<std::int64_t>(static_cast<std::uint64_t>(time.tv_sec) * nanosecondsPerSecond +
                                   time.tv_nsec);
}

/// False when the status cannot be had; the reason is in it.
bool look(int directory, const char* name, int flags, EntryLook& result) {
  struct statx found {};
  constexpr unsigned wanted = STATX_TYPE | STATX_MODE | STATX_UID | STATX_GID | STATX_INO | STATX_CTIME |
                              STATX_MTIME | STATX_SIZE | STATX_MNT_ID;
  if (statx(directory, name, flags | AT_NO_AUTOMOUNT, wanted, &found) != 0) {
    result.status = {};
    result.status.size = static_cast<std::uint64_t>(errno);
    return false;
  }
  result.status = {kindOf(found.stx_mode), found.stx_ino, nanoseconds(found.stx_ctime),
                   nanoseconds(found.stx_mtime), found.stx_size};
  result.device = makedev(found.stx_dev_major, found.stx_dev_minor);
  result.mount = (found.stx_mask & STATX_MNT_ID) ? found.stx_mnt_id : 0;
  for (const std::uint32_t part : {std::uint32_t(found.stx_mode), found.stx_uid, found.stx_gid}) {
    result.attributes.append(std::to_string(part)).append(1, ' ');
  }
  return true;
}

/// Local file systems, on which whatever is changed is changed through this kernel, told, and stamped in the
/// directory, too. Those of removable media are none: other machines change them, and their roots bear no
/// stamps.
bool notifiesOfEveryChange(std::uint64_t magic) {
  static constexpr std::uint64_t local[] = {
      EXT4_SUPER_MAGIC,     XFS_SUPER_MAGIC, BTRFS_SUPER_MAGIC,    TMPFS_MAGIC,
      F2FS_SUPER_MAGIC,     RAMFS_MAGIC,     0x2fc12fc1 /* ZFS */, 0xca451a4e /* bcachefs */,
      REISERFS_SUPER_MAGIC, 0x3153464a /* JFS */};
  return std::find(std::begin(local), std::end(local), magic) != std::end(local);
}

}  // namespace

EntryLook lookAtEntry(const std::string& path) {
  EntryLook result;
  if (!look(AT_FDCWD, path.c_str(), AT_SYMLINK_NOFOLLOW, result)) return result;
  if (result.status.kind != EntryKind::Link) return result;
  result.link = result.status;
  result.device = result.mount = 0;
  look(AT_FDCWD, path.c_str(), 0, result);
  return result;
}

std::int64_t timeStampNow() {
  timespec now{};
  clock_gettime(CLOCK_REALTIME_COARSE, &now);
  return static_cast<std::int64_t>(now.tv_sec) * nanosecondsPerSecond + now.tv_nsec;
}

FileSystemTraits FileSystems::traits(std::uint64_t device, const std::string& path) {
  {
    const std::lock_guard lock(mutex_);
    if (const auto known = known_.find(device); known != known_.end()) return known->second;
  }
  const OwnedDescriptor opened = openFile(AT_FDCWD, path, O_PATH);
  struct statfs status {};
  EntryLook now;
  // The path may lead elsewhere by now: then nothing is known, and asked again the next time.
  const bool isIt = opened && look(opened.get(), "", AT_EMPTY_PATH, now) && now.device == device &&
                    fstatfs(opened.get(), &status) == 0;
  if (!isIt) return {};
  FileSystemTraits traits;
  static_assert(sizeof status.f_fsid == sizeof traits.identity);
  std::copy_n(reinterpret_cast<const char*>(&status.f_fsid), sizeof traits.identity,
              reinterpret_cast<char*>(&traits.identity));
  traits.notifies = notifiesOfEveryChange(static_cast<std::uint64_t>(status.f_type));
  const std::lock_guard lock(mutex_);
  known_.emplace(device, traits);
  return traits;
}

void FileSystems::forget() {
  const std::lock_guard lock(mutex_);
  known_.clear();
}

}  // namespace kel::platform
