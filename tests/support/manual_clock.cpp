#include "support/manual_clock.h"

#include <vector>

namespace kel::test {

namespace {

using namespace std::chrono_literals;

constexpr auto generousLimit = 30s;

std::chrono::nanoseconds later(std::chrono::nanoseconds now, std::chrono::nanoseconds delay) {
  return delay > std::chrono::nanoseconds::max() - now ? std::chrono::nanoseconds::max() : now + delay;
}

}  // namespace

void ManualClock::advance(std::chrono::nanoseconds duration) {
  std::vector<Timer> due;
  {
    const std::lock_guard lock(mutex_);
    now_ += duration;
    wallClock_ += std::chrono::duration<double>(duration).count();
    const auto end = timers_.upper_bound(now_);
    for (auto timer = timers_.begin(); timer != end; ++timer) due.push_back(std::move(timer->second));
    timers_.erase(timers_.begin(), end);
    // Under the lock, without which no waiter can leave and destroy its semaphore.
    for (auto wait = waits_.begin(); wait != waits_.upper_bound(now_); ++wait) wait->second->poke();
  }
  for (auto& [queue, task] : due) queue->async(std::move(task));
}

void ManualClock::setWallClock(double seconds) {
  const std::lock_guard lock(mutex_);
  wallClock_ = seconds;
}

bool ManualClock::awaitTimers(std::size_t count) {
  std::unique_lock lock(mutex_);
  return changed_.wait_for(lock, generousLimit, [&] { return timers_.size() >= count; });
}

bool ManualClock::awaitWaits(std::size_t count) {
  std::unique_lock lock(mutex_);
  return changed_.wait_for(lock, generousLimit, [&] { return waits_.size() >= count; });
}

double ManualClock::wallClockSeconds() const {
  const std::lock_guard lock(mutex_);
  return wallClock_;
}

void ManualClock::after(platform::SerialQueue& queue, std::chrono::nanoseconds delay, platform::Task task) {
  if (delay <= 0ns) return queue.async(std::move(task));
  const std::lock_guard lock(mutex_);
  timers_.emplace(later(now_, delay), Timer(&queue, std::move(task)));
  changed_.notify_all();
}

bool ManualClock::wait(platform::Semaphore& semaphore, std::chrono::nanoseconds timeout) {
  std::unique_lock lock(mutex_);
  const std::chrono::nanoseconds deadline = later(now_, timeout);
  const auto registered = waits_.emplace(deadline, &semaphore);
  changed_.notify_all();
  lock.unlock();
  const bool taken = semaphore.waitUnless([&] {
    const std::lock_guard expiry(mutex_);
    return now_ >= deadline;
  });
  lock.lock();
  waits_.erase(registered);
  return taken;
}

}  // namespace kel::test
