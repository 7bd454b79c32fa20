#include "support/manual_clock.h"

#include <gmock/gmock.h>
#include <thread>
#include <vector>

namespace kel::test {
namespace {

using namespace std::chrono_literals;
using platform::Semaphore;
using platform::SerialQueue;

TEST(ManualClockTest, TimersRunInTheOrderOfTheirDeadlinesAndNotBefore) {
  std::vector<int> seen;
  ManualClock clock(100);
  SerialQueue queue("timers");
  clock.after(queue, 6s, [&] { seen.push_back(6); });
  clock.after(queue, 2s, [&] { seen.push_back(2); });
  clock.after(queue, 0s, [&] { seen.push_back(0); });
  clock.advance(6s - 1ns);
  queue.sync([&] { EXPECT_THAT(seen, testing::ElementsAre(0, 2)); });
  clock.advance(1ns);
  queue.sync([&] { EXPECT_THAT(seen, testing::ElementsAre(0, 2, 6)); });
  EXPECT_DOUBLE_EQ(clock.wallClockSeconds(), 106);
}

TEST(ManualClockTest, AWaitEndsWithASignalOrWhenItsVirtualTimeIsOver) {
  ManualClock clock;
  Semaphore semaphore;
  for (const bool signalled : {true, false}) {
    std::thread waiter([&] { EXPECT_EQ(clock.wait(semaphore, 15s), signalled); });
    ASSERT_TRUE(clock.awaitWaits(1));
    clock.advance(15s - 1ns);
    signalled ? semaphore.signal() : clock.advance(1ns);
    waiter.join();
  }
}

}  // namespace
}  // namespace kel::test
