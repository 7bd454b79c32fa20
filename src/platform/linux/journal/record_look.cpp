#include "platform/linux/journal/record_look.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <fcntl.h>
#include <memory>
#include <sys/inotify.h>
#include <unistd.h>
#include <utility>

#include "platform/linux/files/files.h"

namespace kel::platform {

namespace {

constexpr std::uint32_t directoryMask = IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO | IN_ATTRIB |
                                        IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR | IN_MASK_ADD;
constexpr std::uint32_t fileMask = IN_MODIFY | IN_CLOSE_WRITE | IN_ATTRIB | IN_MASK_ADD;

class Look {
 public:
  Look(const JournalNode& node, const std::string& path, const LookSettings& settings)
      : node_(node), path_(node.parent ? path : node.tree->path()), settings_(settings) {}

  RecordLook take() {
    if (std::chrono::steady_clock::now() > settings_.deadline) return {};
    watch();
    const std::int64_t now = timeStampNow();
    const EntryLook entry = lookAtEntry(path_);
    fill(entry, now);
    if (!node_.parent) findChain();
    if (node_.role == RecordRole::Folder && result_.record.isDirectory()) list();
    // What was compared by its contents once has to be so again.
    const bool wasRacy = node_.record.isRacy && isAlike(node_.record, result_.record);
    if (result_.record.isRacy || wasRacy) {
      if (std::chrono::steady_clock::now() > settings_.deadline) return {};
      takeDigest(entry);
    }
    result_.differs = !isUnchanged(node_.record, result_.record);
    if (!result_.record.isRacy) result_.record.digest.reset();
    result_.isTaken = true;
    return std::move(result_);
  }

 private:
  void watch() {
    if (settings_.inotify < 0) return;
    const bool isFolder = node_.role == RecordRole::Folder;
    const std::uint32_t mask = node_.role == RecordRole::Information ? fileMask : directoryMask;
    if (node_.watch < 0 && settings_.watchesLeft.fetch_sub(1) <= 0) {
      result_.watchError = ENOSPC;
      return;
    }
    result_.watch = inotify_add_watch(settings_.inotify, path_.c_str(),
                                      mask | (isFolder && node_.parent ? IN_DONT_FOLLOW : 0u));
    if (result_.watch < 0 && (errno == ENOSPC || errno == ENOMEM)) result_.watchError = errno;
  }

  void fill(const EntryLook& entry, std::int64_t now) {
    EntryRecord& record = result_.record;
    record.isKnown = true;
    record.status = entry.status;
    record.link = entry.link;
    record.mount = entry.mount;
    const bool exists = entry.status.kind != EntryKind::Unknown;
    const FileSystemTraits traits =
        exists ? settings_.fileSystems.traits(entry.device, path_) : FileSystemTraits();
    record.fileSystem = traits.identity;
    result_.tells = result_.watch >= 0 && traits.notifies;
    if (node_.role == RecordRole::Bundle && record.isDirectory()) {
      record.status.changed = record.status.modified = 0;
      record.status.size = 0;
    } else {
      record.isRacy = exists && isRacy(entry.status.changed, now,
                                       traits.notifies ? TimeStamps::Local : TimeStamps::Foreign);
    }
    // Nobody knows the clock of the file system that the link itself is on.
    record.isRacy |= entry.isLink() && isRacy(entry.link.changed, now, TimeStamps::Foreign);
  }

  void findChain() {
    const std::unique_ptr<char, decltype(&std::free)> real(realpath(path_.c_str(), nullptr), &std::free);
    if (real && result_.record.isDirectory()) result_.chain = real.get();
  }

  /// A folder is listed after its status was taken: what is added in between shows in the next status.
  void list() {
    if (isAlike(node_.record, result_.record) && !node_.record.isRacy && !result_.record.isRacy) return;
    const DirectoryListing listing = openListing(path_);
    for (;;) {
      errno = listing ? 0 : errno;
      const dirent* entry = listing ? readdir(listing.get()) : nullptr;
      if (!entry) break;
      const std::string_view name(entry->d_name);
      const EntryKind kind = kindOf(*entry);
      if (node_.tree->decides(name, kind == EntryKind::Directory)) {
        result_.names.push_back({std::string(name), kind});
      }
    }
    result_.listingError = errno;
    result_.isListed = errno == 0;
    std::ranges::sort(result_.names, {}, &ListedName::name);
  }

  EntryKind kindOf(const dirent& entry) const {
    if (entry.d_type == DT_DIR) return EntryKind::Directory;
    if (entry.d_type == DT_LNK) return EntryKind::Link;
    if (entry.d_type != DT_UNKNOWN) return EntryKind::Other;
    const EntryLook found = lookAtEntry(path_ + "/" + entry.d_name);
    return found.isLink() ? EntryKind::Link : found.status.kind;
  }

  void takeDigest(const EntryLook& entry) {
    constexpr std::size_t largest = 1024 * 1024;
    const EntryRecord& record = result_.record;
    Bytes bytes(entry.attributes.begin(), entry.attributes.end());
    const auto add = [&bytes](std::string_view text) {
      bytes.insert(bytes.end(), text.begin(), text.end());
      bytes.push_back(0);
    };
    if (record.isLink()) {
      std::array<char, PATH_MAX> text;
      const ssize_t length = readlink(path_.c_str(), text.data(), text.size());
      if (length < 0) return;
      add({text.data(), static_cast<std::size_t>(length)});
    }
    if (node_.role == RecordRole::Folder && record.isDirectory()) {
      if (!result_.isListed) return;
      for (const ListedName& name : result_.names) {
        add(name.name);
        bytes.push_back(static_cast<std::uint8_t>(name.kind));
      }
    } else if (record.status.kind == EntryKind::File && node_.role == RecordRole::Information) {
      const auto contents = readFile(AT_FDCWD, path_, largest);
      if (!contents) return;
      bytes.insert(bytes.end(), contents->begin(), contents->end());
    }
    result_.record.digest = md5(bytes);
  }

  const JournalNode& node_;
  const std::string path_;  // a root's with its "/", which follows links
  const LookSettings& settings_;
  RecordLook result_;
};

}  // namespace

RecordLook lookAt(const JournalNode& node, const std::string& path, const LookSettings& settings) {
  return Look(node, path, settings).take();
}

}  // namespace kel::platform
