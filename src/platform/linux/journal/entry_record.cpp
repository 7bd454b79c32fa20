#include "platform/linux/journal/entry_record.h"

#include "platform/linux/files/sealed_bytes.h"

namespace kel::platform {

bool isRacy(std::int64_t changed, std::int64_t now, TimeStamps stamps) {
  // A stamp without small digits is that of a file system that counts in hundredths or whole seconds.
  constexpr std::int64_t tick = 20'000'000;
  constexpr std::int64_t coarse = 2'100'000'000;
  constexpr std::int64_t foreign = 60'000'000'000;
  if (stamps == TimeStamps::Foreign) return changed > now - foreign;
  return changed > now - (changed % 10'000'000 == 0 ? coarse : tick);
}

bool isSameEntry(const EntryRecord& before, const EntryRecord& now) {
  return before.isKnown && before.status.kind == now.status.kind && before.status.inode == now.status.inode &&
         before.link == now.link && before.fileSystem == now.fileSystem && before.mount == now.mount;
}

bool isAlike(const EntryRecord& before, const EntryRecord& now) {
  return isSameEntry(before, now) && before.status == now.status;
}

bool isUnchanged(const EntryRecord& before, const EntryRecord& now) {
  return isAlike(before, now) && (!before.isRacy || (before.digest && before.digest == now.digest));
}

void writeStatus(ByteWriter& writer, const EntryStatus& status) {
  writer.number(static_cast<unsigned>(status.kind));
  writer.number(status.inode);
  writer.fixed(static_cast<std::uint64_t>(status.changed));
  writer.fixed(static_cast<std::uint64_t>(status.modified));
  writer.number(status.size);
}

EntryStatus readStatus(ByteReader& reader) {
  EntryStatus status;
  const std::uint64_t kind = reader.number();
  if (kind > static_cast<unsigned>(EntryKind::Other)) reader.fail();
  status.kind = reader.failed() ? EntryKind::Unknown : static_cast<EntryKind>(kind);
  status.inode = reader.number();
  status.changed = static_cast<std::int64_t>(reader.fixed());
  status.modified = static_cast<std::int64_t>(reader.fixed());
  status.size = reader.number();
  return status;
}

}  // namespace kel::platform
