#include <algorithm>
#include <condition_variable>
#include <mutex>

#include "platform/work_queue.h"

namespace kel::platform {

struct Semaphore::State {
  bool take() {
    if (count == 0) return false;
    --count;
    return true;
  }

  std::mutex mutex;
  std::condition_variable changed;
  std::size_t count = 0;
};

Semaphore::Semaphore(std::size_t count) : state_(std::make_unique<State>()) { state_->count = count; }
Semaphore::~Semaphore() = default;

// Notifies under the lock: a waiter that is through may destroy the semaphore at once.
void Semaphore::signal() {
  const std::lock_guard lock(state_->mutex);
  ++state_->count;
  state_->changed.notify_one();
}

bool Semaphore::wait(std::chrono::nanoseconds timeout) {
  // Kept far from where adding to the present overflows.
  const std::chrono::nanoseconds bounded =
      std::min<std::chrono::nanoseconds>(timeout, std::chrono::years(100));
  std::unique_lock lock(state_->mutex);
  state_->changed.wait_for(lock, bounded, [this] { return state_->count > 0; });
  return state_->take();
}

}  // namespace kel::platform
