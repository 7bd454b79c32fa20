#pragma once

#include <atomic>
#include <condition_variable>
#include <cstddef>
#include <map>
#include <mutex>
#include <utility>
#include <vector>

#include "platform/clock.h"

namespace kel::test {

/// A clock whose time passes only when a test says so. Any thread.
class ManualClock : public platform::Clock {
  using Duration = std::chrono::nanoseconds;
  using Timer = std::pair<platform::SerialQueue*, platform::Task>;
  struct Wait {
    platform::Semaphore* semaphore;
    bool isOver = false;  // its time has passed, for which the semaphore was signalled
  };

 public:
  /// Lets `duration` pass: timers that fall due are queued on their queues in the order of their deadlines,
  /// waits whose time is over end. The wall clock moves along. A queued task that sets a timer in turn sets
  /// it at the new time.
  void advance(Duration duration) {
    std::vector<Timer> due;
    {
      const std::lock_guard lock(mutex_);
      now_ += duration;
      wallClock = wallClock + std::chrono::duration<double>(duration).count();
      const auto end = timers_.upper_bound(now_);
      for (auto timer = timers_.begin(); timer != end; ++timer) due.push_back(std::move(timer->second));
      timers_.erase(timers_.begin(), end);
      // Under the lock, without which no waiter can leave and destroy its semaphore.
      for (auto wait = waits_.begin(); wait != waits_.upper_bound(now_); ++wait) {
        if (!std::exchange(wait->second.isOver, true)) wait->second.semaphore->signal();
      }
    }
    for (auto& [queue, task] : due) queue->async(std::move(task));
  }

  /// Wait, in real time with a generous limit, until at least `count` timers or timed waits are pending;
  /// false when the limit passed.
  [[nodiscard]] bool awaitTimers(std::size_t count) { return awaitPending(timers_, count); }
  [[nodiscard]] bool awaitWaits(std::size_t count) { return awaitPending(waits_, count); }

  double wallClockSeconds() const override { return wallClock; }
  void after(platform::SerialQueue& queue, Duration delay, platform::Task task) override {
    if (delay <= Duration::zero()) return queue.async(std::move(task));
    const std::lock_guard lock(mutex_);
    timers_.emplace(deadlineAfter(delay), Timer(&queue, std::move(task)));
    changed_.notify_all();
  }
  bool wait(platform::Semaphore& semaphore, Duration timeout) override {
    std::unique_lock lock(mutex_);
    const auto registered = waits_.emplace(deadlineAfter(timeout), Wait{&semaphore});
    const bool isOver = timeout <= Duration::zero();
    changed_.notify_all();
    lock.unlock();
    const bool taken = semaphore.wait(isOver ? Duration::zero() : Duration::max());
    lock.lock();
    const Wait wait = waits_.extract(registered).mapped();
    // The signal of the end counts for nothing: what else was signalled is what was waited for.
    return wait.isOver ? semaphore.wait(Duration::zero()) : taken;
  }

  std::atomic<double> wallClock = 0;

 private:
  Duration deadlineAfter(Duration delay) const {
    return delay > Duration::max() - now_ ? Duration::max() : now_ + delay;
  }
  bool awaitPending(const auto& pending, std::size_t count) {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, std::chrono::seconds(30), [&] { return pending.size() >= count; });
  }

  std::mutex mutex_;
  std::condition_variable changed_;
  Duration now_{0};
  std::multimap<Duration, Timer> timers_;  // by deadline
  std::multimap<Duration, Wait> waits_;    // by deadline
};

}  // namespace kel::test
