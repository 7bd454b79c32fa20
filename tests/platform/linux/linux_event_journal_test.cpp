#include "platform/linux/linux_event_journal.h"

#include <gtest/gtest.h>
#include <set>
#include <thread>
#include <vector>

#include "platform/guarded.h"

namespace kel::platform {
namespace {

TEST(LinuxEventJournal, PositionsGrowAndAreNeverGivenTwice) {
  LinuxEventJournal journal;
  Guarded<std::set<EventID>> all;
  constexpr int count = 1000;
  std::vector<std::thread> threads;
  for (int i = 0; i < 4; ++i) {
    threads.emplace_back([&] {
      EventID previous = 0;
      for (int j = 0; j < count; ++j) {
        const EventID position = journal.currentEventID();
        EXPECT_GT(position, previous);
        all.with([position](auto& positions) { positions.insert(position); });
        previous = position;
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(all.copy().size(), 4u * count);
}

}  // namespace
}  // namespace kel::platform
