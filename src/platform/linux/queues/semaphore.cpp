#include <algorithm>
#include <condition_variable>
#include <cstdint>
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
  std::uint64_t pokes = 0;
};

Semaphore::Semaphore(std::size_t count) : state_(std::make_unique<State>()) { state_->count = count; }
Semaphore::~Semaphore() = default;

// Both notify under the lock: a waiter that is through may destroy the semaphore at once.
void Semaphore::signal() {
  const std::lock_guard lock(state_->mutex);
  ++state_->count;
  state_->changed.notify_one();
}

void Semaphore::poke() {
  const std::lock_guard lock(state_->mutex);
  ++state_->pokes;
  state_->changed.notify_all();
}

bool Semaphore::wait(std::chrono::nanoseconds timeout) {
  // Kept far from where adding to the present overflows.
  const std::chrono::nanoseconds bounded =
      std::min<std::chrono::nanoseconds>(timeout, std::chrono::years(100));
  std::unique_lock lock(state_->mutex);
  state_->changed.wait_for(lock, bounded, [this] { return state_->count > 0; });
  return state_->take();
}

bool Semaphore::waitUnless(const std::function<bool()>& expired) {
  std::unique_lock lock(state_->mutex);
  for (;;) {
    if (state_->take()) return true;
    const std::uint64_t asked = state_->pokes;
    lock.unlock();
    const bool givesUp = expired();
    lock.lock();
    if (givesUp) return state_->take();
    state_->changed.wait(lock, [&] { return state_->count > 0 || state_->pokes != asked; });
  }
}

}  // namespace kel::platform
