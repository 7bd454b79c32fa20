#pragma once

#include <memory>
#include <optional>
#include <string_view>
#include <vector>

#include "platform/linux/journal/journal_tree.h"
#include "property_lists/bytes.h"

namespace kel::platform {

/// The file that keeps the journal's trees between runs: see docs/journal.md.
struct JournalIndex {
  EventID lastID = 0;
  std::vector<std::unique_ptr<JournalTree>> trees;
};

inline constexpr std::string_view indexFormat = "kel journal index 2";

/// The bytes of the index file. A tree that was never seen whole is left out: what changes in it cannot be
/// told from that. Events before a tree's horizon are left out as well.
Bytes encodeIndex(EventID lastID, const std::vector<std::unique_ptr<JournalTree>>& trees);

/// Reads an index file; absent, whatever is wrong with it. Trees of other roots than `roots` are left out.
/// What is read is not verified: every record is doubted.
std::optional<JournalIndex> decodeIndex(BytesView file, const std::vector<WatchedRoot>& roots);

}  // namespace kel::platform
