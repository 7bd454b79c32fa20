#include "platform/linux/journal/directory_look.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <dirent.h>
#include <fcntl.h>
#include <linux/magic.h>
#include <sys/inotify.h>
#include <sys/statfs.h>

#include "platform/linux/files/files.h"
#include "platform/linux/journal/entry_look.h"

namespace kel::platform {

namespace {

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

FileSystemTraits traitsOf(int descriptor) {
  struct statfs status {};
  if (fstatfs(descriptor, &status) != 0) return {};
  std::uint64_t identity = 0;
  static_assert(sizeof status.f_fsid == sizeof identity);
  std::copy_n(reinterpret_cast<const char*>(&status.f_fsid), sizeof identity,
              reinterpret_cast<char*>(&identity));
  return {identity, notifiesOfEveryChange(static_cast<std::uint64_t>(status.f_type))};
}

class Listing {
 public:
  Listing(DirectoryLook& look, const LookSettings& settings) : look_(look), settings_(settings) {}

  void take(JournalNode& node, const std::string& path) {
    look_.isListing = true;
    const bool followsLinks = !node.record.isDirectory() || !node.parent;
    // Watched first, listed second: what changes in between is told by the watch.
    if (settings_.inotify >= 0) {
      const std::uint32_t mask = settings_.watchMask | IN_ONLYDIR | (followsLinks ? 0u : IN_DONT_FOLLOW);
      const bool mayWatch = node.directory->watch >= 0 || settings_.watchesLeft->fetch_sub(1) > 0;
      if (mayWatch) look_.watch = inotify_add_watch(settings_.inotify, path.c_str(), mask);
      if (look_.watch < 0) look_.watchError = mayWatch ? errno : ENOSPC;
    }
    taking_.now = timeStampNow();
    taking_.deadline = settings_.deadline;
    const OwnedDescriptor opened = openFile(
        AT_FDCWD, path, O_RDONLY | O_DIRECTORY | O_NONBLOCK | O_NOCTTY | (followsLinks ? 0 : O_NOFOLLOW));
    if (!opened) {
      look_.error = errno;
      return;
    }
    look_.own = statusOf(opened.get(), look_.device);
    look_.fileSystem = traitsOf(opened.get());
    taking_.stamps = look_.fileSystem.notifies ? TimeStamps::Local : TimeStamps::Foreign;
    // Where a watch tells of the next change, telling it from the record is not worth a reading.
    taking_.digestIfRacy = settings_.alwaysDigest || look_.watch < 0 || !look_.fileSystem.notifies ||
                           outermostLink(node) != nullptr;
    look_.ownIsRacy = isRacy(look_.own.changed, taking_.now, taking_.stamps);
    const JournalDirectory& known = *node.directory;
    if (known.listingIsSound && known.error == 0 && known.listing == look_.own &&
        known.fileSystem == look_.fileSystem.identity) {
      keepNames(known, opened.get());
    } else {
      compareNames(known, opened.get());
    }
  }

 private:
  void keepNames(const JournalDirectory& known, int descriptor) {
    for (const auto& [name, child] : known.children) {
      if (isLate()) return;
      if (!child->isGone && !child->record.isDirectory()) compareEntry(*child, name.c_str(), descriptor);
    }
  }

  void compareEntry(JournalNode& child, const char* name, int descriptor) {
    EntryRecord record = takeRecord(descriptor, name, &child.record, taking_);
    if (!(record == child.record)) look_.recorded.emplace_back(&child, std::move(record));
  }

  struct Name {
    std::string text;
    unsigned char type = DT_UNKNOWN;
    std::uint64_t inode = 0;
  };

  void compareNames(const JournalDirectory& known, int descriptor) {
    std::vector<Name> names = list(descriptor);
    if (look_.error != 0) return;
    std::sort(names.begin(), names.end(), [](const Name& a, const Name& b) { return a.text < b.text; });
    auto child = known.children.begin();
    for (Name& name : names) {
      for (; child != known.children.end() && child->first < name.text; ++child) noteGone(*child->second);
      const bool isKnown = child != known.children.end() && child->first == name.text;
      if (isLate()) return;
      compareName(isKnown ? (child++)->second.get() : nullptr, name, descriptor);
    }
    for (; child != known.children.end(); ++child) noteGone(*child->second);
  }

  void noteGone(JournalNode& child) {
    if (!child.isGone) look_.gone.push_back(&child);
  }

  void compareName(JournalNode* child, Name& name, int descriptor) {
    const bool isKnown = child && !child->isGone;
    if (name.type == DT_DIR) {
      if (isKnown && child->record.isDirectory()) {
        if (child->directory->listing.inode != name.inode) look_.suspected.push_back(child);
        return;
      }
      EntryRecord record;
      record.isKnown = true;
      record.status.kind = EntryKind::Directory;
      look_.added.emplace_back(std::move(name.text), std::move(record));
    } else if (isKnown && !child->record.isDirectory()) {
      compareEntry(*child, name.text.c_str(), descriptor);
    } else {
      EntryRecord record = takeRecord(descriptor, name.text.c_str(), nullptr, taking_);
      if (isKnown && record.isDirectory()) return look_.suspected.push_back(child);
      look_.added.emplace_back(std::move(name.text), std::move(record));
    }
  }

  /// On a slow file system even one directory can take longer than there is time.
  bool isLate() {
    constexpr int entriesPerCheck = 64;
    if (++entries_ % entriesPerCheck == 0) {
      look_.isLate = look_.isLate || std::chrono::steady_clock::now() > settings_.deadline;
    }
    return look_.isLate;
  }

  std::vector<Name> list(int descriptor) {
    std::vector<Name> names;
    alignas(dirent64) std::array<char, 32768> buffer;
    for (;;) {
      const ssize_t length = getdents64(descriptor, buffer.data(), buffer.size());
      look_.error = length < 0 ? errno : 0;
      if (length <= 0) return names;
      for (ssize_t at = 0; at < length;) {
        const auto* entry = reinterpret_cast<const dirent64*>(&buffer[static_cast<std::size_t>(at)]);
        at += entry->d_reclen;
        const std::string_view name(entry->d_name);
        if (name != "." && name != "..") names.push_back({std::string(name), entry->d_type, entry->d_ino});
      }
      if (names.size() > settings_.mostEntries) {
        look_.error = E2BIG;
        return names;
      }
    }
  }

  DirectoryLook& look_;
  const LookSettings& settings_;
  RecordTaking taking_;
  int entries_ = 0;
};

}  // namespace

DirectoryLook lookAt(JournalNode& node, const std::string& path, const LookSettings& settings) {
  DirectoryLook look;
  look.node = &node;
  look.isLate = std::chrono::steady_clock::now() > settings.deadline;
  if (look.isLate) return look;
  if (!node.record.isDirectory()) {
    look.hasRecord = true;
    RecordTaking taking;
    taking.now = timeStampNow();
    taking.deadline = settings.deadline;
    const bool notifies = node.parent && node.parent->directory->notifies;
    taking.stamps = notifies ? TimeStamps::Local : TimeStamps::Foreign;
    taking.digestIfRacy = settings.alwaysDigest || !notifies;
    look.record = takeRecord(AT_FDCWD, path.c_str(), node.record.isKnown ? &node.record : nullptr, taking);
    // What leads to a directory only since now is listed when that is known.
    if (!look.record.leadsToDirectory() || !node.directory || node.isBoundless) return look;
  }
  Listing(look, settings).take(node, path);
  return look;
}

}  // namespace kel::platform
