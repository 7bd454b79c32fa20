#include "platform/linux/journal/journal_index.h"
#include "sealed_check.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace kel::platform;
  const auto rewrite = [](BytesView file) -> std::optional<Bytes> {
    const auto index = decodeIndex(file, {{"/one/", false}, {"/two/", true}});
    if (!index) return std::nullopt;
    Bytes written = encodeIndex(index->lastID, index->trees);
    for (const auto& tree : index->trees) {
      if (tree->root().state != RecordState::Doubted || tree->root().role != RecordRole::Folder) std::abort();
      tree->clear(tree->root());
      if (tree->nodeCount != 0 || tree->goneCount != 0 || tree->doubtedCount != 1) std::abort();
    }
    return written;
  };
  checkRewriting({data, size}, indexFormat, rewrite);
  return 0;
}
