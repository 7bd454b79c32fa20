#include "platform/linux/journal/journal_index.h"

#include <algorithm>
#include <utility>

#include "platform/linux/files/sealed_bytes.h"

namespace kel::platform {

namespace {

enum Flag : unsigned {
  isKnown = 0x1,
  isRacy = 0x2,
  isGone = 0x4,
  isLink = 0x8,
  hasDigest = 0x10,
  isBundle = 0x20,
};

class TreeWriter {
 public:
  TreeWriter(ByteWriter& writer, EventID horizon) : writer_(writer), horizon_(horizon) {}

  void write(const JournalNode& node) {
    const EntryRecord& record = node.record;
    // A racy entry without a digest could not be told from a changed one.
    const bool known = record.isKnown && !(record.isRacy && !record.digest);
    const bool gone = node.state == RecordState::Gone;
    writer_.number((known ? isKnown : 0u) | (record.isRacy ? isRacy : 0u) | (gone ? isGone : 0u) |
                   (record.isLink() ? isLink : 0u) | (record.digest ? hasDigest : 0u) |
                   (node.role == RecordRole::Bundle ? isBundle : 0u));
    writer_.number(node.changed > horizon_ ? node.changed : 0);
    if (gone) return;
    writeStatus(writer_, record.status);
    writer_.number(record.fileSystem);
    writer_.number(record.mount);
    if (record.isLink()) writeStatus(writer_, record.link);
    if (record.digest) writer_.bytes(*record.digest);
    if (node.role == RecordRole::Information) return;
    writer_.number(node.listed > horizon_ ? node.listed : 0);
    writer_.number(node.children.size());
    for (const auto& [name, child] : node.children) {
      writer_.string(name);
      write(*child);
    }
  }

 private:
  ByteWriter& writer_;
  const EventID horizon_;
};

class TreeReader {
 public:
  TreeReader(ByteReader& reader, EventID lastID) : reader_(reader), lastID_(lastID) {}

  /// `node` is a root, or has just been added as a folder.
  void read(JournalNode& node, int depth = 0) {
    constexpr int deepest = 20;
    const std::uint64_t flags = reader_.number();
    if (node.parent && node.parent->role == RecordRole::Bundle) {
      node.role = RecordRole::Information;
    } else if (flags & isBundle) {
      node.role = RecordRole::Bundle;
    }
    const EventID changed = readID();
    const bool mayBeGone = node.role != RecordRole::Information && node.parent;
    const bool mayBeBundle = node.role == RecordRole::Bundle && node.parent;
    if (flags >= 2 * isBundle || depth > deepest || ((flags & isGone) && !mayBeGone) ||
        ((flags & isBundle) && !mayBeBundle)) {
      return reader_.fail();
    }
    if (flags & isGone) return node.tree->bury(node, changed);
    readRecord(node.record, flags);
    JournalTree::markChanged(node, changed);
    if (node.role != RecordRole::Information) readChildren(node, depth);
  }

 private:
  void readRecord(EntryRecord& record, std::uint64_t flags) {
    record.isKnown = (flags & isKnown) != 0;
    record.isRacy = (flags & isRacy) != 0;
    record.status = readStatus(reader_);
    record.fileSystem = reader_.number();
    record.mount = reader_.number();
    if (flags & isLink) {
      record.link = readStatus(reader_);
      if (!record.isLink()) reader_.fail();
    }
    if (flags & hasDigest) {
      const BytesView digest = reader_.bytes(sizeof(Digest));
      std::copy(digest.begin(), digest.end(), record.digest.emplace().begin());
    }
  }

  void readChildren(JournalNode& node, int depth) {
    JournalTree::markListed(node, readID());
    const std::size_t count = reader_.count();
    if (node.role == RecordRole::Bundle && count > 1) return reader_.fail();
    for (std::size_t left = count; left > 0 && !reader_.failed(); --left) {
      const std::string_view name = reader_.string();
      // Names come in order, as they were written: so they are also different.
      const bool isInOrder = node.children.empty() || node.children.rbegin()->first < name;
      const bool isRight = node.role != RecordRole::Bundle || name == JournalTree::informationName;
      if (!isInOrder || !isRight || name.empty() || name.starts_with('.') || name.find('/') != name.npos ||
          name.find('\0') != name.npos) {
        return reader_.fail();
      }
      read(node.tree->add(node, name, RecordRole::Folder), depth + 1);
    }
  }

  EventID readID() {
    const EventID id = reader_.number();
    if (id > lastID_) reader_.fail();
    return id;
  }

  ByteReader& reader_;
  const EventID lastID_;
};

}  // namespace

Bytes encodeIndex(EventID lastID, const std::vector<std::unique_ptr<JournalTree>>& trees) {
  ByteWriter writer;
  writer.number(lastID);
  for (const auto& tree : trees) {
    if (tree->horizon == JournalTree::noHorizon || tree->isTooLarge) continue;
    writer.string(tree->path());
    writer.string(tree->chain);
    writer.number(tree->horizon);
    TreeWriter(writer, tree->horizon).write(tree->root());
  }
  return writer.sealed(indexFormat);
}

std::optional<JournalIndex> decodeIndex(BytesView file, const std::vector<WatchedRoot>& roots) {
  auto reader = ByteReader::open(file, indexFormat);
  if (!reader) return std::nullopt;
  JournalIndex index;
  index.lastID = reader->number();
  while (!reader->failed() && !reader->atEnd()) {
    const std::string path(reader->string());
    const auto root =
        std::find_if(roots.begin(), roots.end(), [&](const auto& one) { return one.path == path; });
    const bool isWanted =
        root != roots.end() && std::none_of(index.trees.begin(), index.trees.end(),
                                            [&](const auto& other) { return other->path() == path; });
    auto tree = std::make_unique<JournalTree>(isWanted ? *root : WatchedRoot{"/", false});
    tree->chain = reader->string();
    tree->horizon = reader->number();
    if (tree->horizon > index.lastID) reader->fail();
    TreeReader(*reader, index.lastID).read(tree->root());
    if (isWanted) index.trees.push_back(std::move(tree));
  }
  return reader->failed() ? std::nullopt : std::optional(std::move(index));
}

}  // namespace kel::platform
