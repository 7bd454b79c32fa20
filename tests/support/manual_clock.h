#pragma once

#include <condition_variable>
#include <cstddef>
#include <map>
#include <mutex>
#include <utility>

#include "platform/clock.h"

namespace kel::test {

/// A clock whose time passes only when a test says so. Any thread.
class ManualClock : public platform::Clock {
 public:
  explicit ManualClock(double wallClockSeconds = 0) : wallClock_(wallClockSeconds) {}

  /// Lets `duration` pass: timers that fall due are queued on their queues in the order of their deadlines,
  /// waits whose time is over end. The wall clock moves along. A queued task that sets a timer in turn sets
  /// it at the new time.
  void advance(std::chrono::nanoseconds duration);

  /// Sets the wall clock, and nothing else.
  void setWallClock(double seconds);

  /// Wait, in real time with a generous limit, until at least `count` timers or timed waits are pending;
  /// false when the limit passed.
  [[nodiscard]] bool awaitTimers(std::size_t count);
  [[nodiscard]] bool awaitWaits(std::size_t count);

  double wallClockSeconds() const override;
  void after(platform::SerialQueue& queue, std::chrono::nanoseconds delay, platform::Task task) override;
  bool wait(platform::Semaphore& semaphore, std::chrono::nanoseconds timeout) override;

 private:
  using Timer = std::pair<platform::SerialQueue*, platform::Task>;

  mutable std::mutex mutex_;
  std::condition_variable changed_;
  std::chrono::nanoseconds now_{0};
  double wallClock_;
  std::multimap<std::chrono::nanoseconds, Timer> timers_;                // by deadline
  std::multimap<std::chrono::nanoseconds, platform::Semaphore*> waits_;  // by deadline
};

}  // namespace kel::test
