#include <gmock/gmock.h>
#include <thread>

#include "platform/linux/queues/linux_clock.h"
#include "support/manual_clock.h"

namespace kel::platform {
namespace {

using namespace std::chrono_literals;

struct ManualTime {
  /// Lets time pass until `done` is signalled.
  bool passUntil(Semaphore& done) {
    for (int i = 0; i < 10'000; ++i) {
      if (done.wait(1ms)) return true;
      clock.advance(1ms);
      queue.sync([] {});
    }
    return false;
  }
  test::ManualClock clock;
  SerialQueue queue{"timers"};
};

struct LinuxTime {
  bool passUntil(Semaphore& done) { return clock.wait(done, 30s); }
  LinuxClock clock;
  SerialQueue queue{"timers"};
};

template <typename Time>
class ClockContractTest : public testing::Test {};
using Times = testing::Types<ManualTime, LinuxTime>;
TYPED_TEST_SUITE(ClockContractTest, Times);

TYPED_TEST(ClockContractTest, TimersAndWaitsAreOverInTheOrderOfTheirDeadlinesAndNotBeforeThem) {
  TypeParam time;
  std::vector<int> seen;
  Semaphore over, signalled(1);
  const double start = time.clock.wallClockSeconds();
  const auto elapsed = [&] { return time.clock.wallClockSeconds() - start; };
  time.queue.sync([&] {
    const auto set = [&](std::chrono::nanoseconds delay, int mark) {
      time.clock.after(time.queue, delay, [&, delay, mark] {
        EXPECT_GE(elapsed(), std::chrono::duration<double>(delay).count() - 0.001);
        seen.push_back(mark);
        if (mark == 3) over.signal();
      });
    };
    set(100ms, 3);
    set(1ms, 1);
    set(std::chrono::nanoseconds::max(), 4);
    set(1ms, 2);
    set(-1s, 0);
  });
  ASSERT_TRUE(time.passUntil(over));
  EXPECT_THAT(seen, testing::ElementsAre(0, 1, 2, 3));

  std::thread waiter([&, before = elapsed()] {
    EXPECT_TRUE(time.clock.wait(signalled, std::chrono::nanoseconds::max()));
    EXPECT_FALSE(time.clock.wait(signalled, 20ms));
    EXPECT_GE(elapsed() - before, 0.019);
    over.signal();
    EXPECT_TRUE(time.clock.wait(signalled, std::chrono::nanoseconds::max()));
  });
  EXPECT_TRUE(time.passUntil(over));
  signalled.signal();
  waiter.join();
}

}  // namespace
}  // namespace kel::platform
