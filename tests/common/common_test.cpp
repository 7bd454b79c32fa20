#include "common/common.h"

#include <cstdlib>
#include <gtest/gtest.h>
#include <random>
#include <thread>

#include "common/path_set.h"
#include "support/debug_lines.h"

namespace kel {
namespace {

using test::debugLines;

TEST(DebugSinkTest, NestedSinksAreRestoredInReverseOrderAndNothingIsFormattedForNone) {
  const std::string outer = debugLines([] {
    const std::string inner = debugLines([] { send_debug_line([] { return "inner"; }); });
    run_with_debug_sink(nullptr, [] { send_debug_line([]() -> std::string { std::abort(); }); });
    send_debug_line([&] { return "outer after " + inner; });
  });
  EXPECT_EQ(outer, "outer after inner");
  EXPECT_EQ(current_debug_sink(), nullptr);
}

TEST(DebugSinkTest, ASinkBelongsToItsThreadAndParallelWorkersShareTheCallers) {
  platform::ConcurrentQueue queue;
  const std::vector<int> elements{1, 2, 3, 4, 5, 6, 7, 8};
  const std::string lines = debugLines([&] {
    std::thread([] { send_debug_line([] { return "another thread"; }); }).join();
    apply_concurrently(queue, elements, [](int element) {
      send_debug_line([element] { return std::string(20, static_cast<char>('0' + element)); });
    });
  });
  EXPECT_EQ(lines.size(), elements.size() * 21 - 1) << lines;
  for (const int element : elements) {
    EXPECT_NE(lines.find(std::string(20, static_cast<char>('0' + element))), std::string::npos) << lines;
  }
}

TEST(PathSetTest, AnswersLikeAWalkOverAllElements) {
  std::mt19937 random(20010101);
  const auto randomPath = [&] {
    std::string path;
    for (auto length = random() % 6; length > 0; --length) path += "/ab"[random() % 3];
    return path;
  };
  for (int round = 0; round < 200; ++round) {
    PathSet set;
    std::set<std::string> model;
    for (int step = 0; step < 12; ++step) {
      const std::string inserted = randomPath();
      set.insert(inserted);
      model.insert(inserted);
      const std::string path = randomPath();
      const bool holdsPrefix = std::any_of(
          model.begin(), model.end(), [&](const std::string& element) { return path.starts_with(element); });
      std::set<std::string> under;
      std::copy_if(model.begin(), model.end(), std::inserter(under, under.end()),
                   [&](const std::string& element) { return element.starts_with(path); });
      std::set<std::string> found;
      set.addElementsUnder(path, found);
      ASSERT_EQ(set.holdsPrefixOf(path), holdsPrefix) << path << " in " << testing::PrintToString(model);
      ASSERT_EQ(found, under) << path;
    }
  }
}

}  // namespace
}  // namespace kel
