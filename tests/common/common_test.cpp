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
  for (const int element : elements)
    EXPECT_NE(lines.find(std::string(20, static_cast<char>('0' + element))), std::string::npos) << lines;
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
      set.insert(*model.insert(randomPath()).first);
      const std::string path = randomPath();
      bool holdsPrefix = false;
      std::set<std::string> under, found;
      for (const std::string& element : model) {
        holdsPrefix |= path.starts_with(element);
        if (element.starts_with(path)) under.insert(element);
      }
      set.addElementsUnder(path, found);
      ASSERT_EQ(set.holdsPrefixOf(path), holdsPrefix) << path << " in " << testing::PrintToString(model);
      ASSERT_EQ(found, under) << path;
    }
  }
}

}  // namespace
}  // namespace kel
