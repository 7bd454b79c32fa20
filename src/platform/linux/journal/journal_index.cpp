#include "platform/linux/journal/journal_index.h"

#include <algorithm>
#include <limits>
#include <utility>

#include "platform/linux/files/sealed_bytes.h"

namespace kel::platform {

namespace {

// A path is at most 4096 bytes long, so no directory that can be reached lies deeper.
constexpr int deepest = 2048;

enum Flag : unsigned {
  isKnown = 0x1,
  isRacy = 0x2,
  isGone = 0x4,
  isSound = 0x10,
};

class TreeWriter {
 public:
  TreeWriter(ByteWriter& writer, EventID horizon) : writer_(writer), horizon_(horizon) {}

  void write(const JournalNode& node) {
    const EntryRecord& record = node.record;
    // A racy entry without a digest could not be told from a changed one.
    const bool known = record.isKnown && !(record.isRacy && !record.digest);
    const JournalDirectory* directory = node.directory.get();
    writer_.number((known ? isKnown : 0u) | (record.isRacy ? isRacy : 0u) | (node.isGone ? isGone : 0u) |
                   (directory && directory->listingIsSound ? isSound : 0u));
    writeStatus(writer_, record.status);
    if (record.isLink()) writeStatus(writer_, record.target);
    writer_.number(record.digest ? 1 : 0);
    if (record.digest) writer_.bytes(*record.digest);
    writer_.number(node.changed > horizon_ ? node.changed : 0);
    if (!directory) return;
    writeStatus(writer_, directory->listing);
    writer_.number(static_cast<std::uint64_t>(directory->error));
    writer_.number(directory->fileSystem);
    writer_.number(directory->listed > horizon_ ? directory->listed : 0);
    writer_.number(directory->children.size());
    for (const auto& [name, child] : directory->children) {
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

  void read(JournalNode& node, int depth = 0) {
    const std::uint64_t flags = reader_.number();
    EntryRecord record;
    record.isKnown = (flags & isKnown) != 0;
    record.isRacy = (flags & isRacy) != 0;
    record.status = readStatus(reader_);
    if (record.isLink()) record.target = readStatus(reader_);
    if (reader_.number() != 0) {
      const BytesView digest = reader_.bytes(sizeof(Digest));
      record.digest.emplace();
      std::copy(digest.begin(), digest.end(), record.digest->begin());
    }
    const EventID changed = readID();
    const bool leadsToDirectory = record.leadsToDirectory();
    // A root is a directory, also while it is missing.
    const bool isPossible = node.parent || (record.isDirectory() && (flags & isGone) == 0);
    if (depth > deepest || !isPossible) return reader_.fail();
    node.record = std::move(record);
    if (flags & isGone) {
      node.isGone = true;
      ++node.tree->vanishedCount;
    } else if (leadsToDirectory) {
      readDirectory(node, (flags & isSound) != 0, depth);
    }
    JournalTree::markChanged(node, changed);
  }

 private:
  void readDirectory(JournalNode& node, bool listingIsSound, int depth) {
    if (!node.directory) node.directory = std::make_unique<JournalDirectory>();
    JournalDirectory& directory = *node.directory;
    node.pending = node.tree->pending.insert(node.tree->pending.end(), &node);
    directory.listing = readStatus(reader_);
    directory.listingIsSound = listingIsSound;
    directory.error = static_cast<int>(reader_.number() & 0xffff);
    directory.fileSystem = reader_.number();
    JournalTree::markListed(node, readID());
    for (std::size_t left = reader_.count(); left > 0 && !reader_.failed(); --left) {
      const std::string_view name = reader_.string();
      // Names come in order, as they were written: so they are also different.
      if (name.empty() || name == "." || name == ".." || name.find('/') != name.npos ||
          name.find('\0') != name.npos ||
          (!directory.children.empty() && directory.children.rbegin()->first >= name)) {
        return reader_.fail();
      }
      read(node.tree->add(node, name, {}), depth + 1);
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
    tree->horizon = reader->number();
    if (tree->horizon > index.lastID) reader->fail();
    TreeReader(*reader, index.lastID).read(tree->root());
    if (isWanted) index.trees.push_back(std::move(tree));
  }
  return reader->failed() ? std::nullopt : std::optional(std::move(index));
}

}  // namespace kel::platform
