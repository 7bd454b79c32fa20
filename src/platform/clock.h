#pragma once

#include <chrono>

#include "platform/work_queue.h"

namespace kel::platform {

/// Time. Callable from any thread.
class Clock {
 public:
  virtual ~Clock() = default;

  /// Wall-clock time in seconds; it may be set back.
  virtual double wallClockSeconds() const = 0;

  /// Queues `task` on `queue`, which outlives the wait, when `delay` has passed; a delay that is not positive
  /// means at once.
  virtual void after(SerialQueue& queue, std::chrono::nanoseconds delay, Task task) = 0;

  /// Takes one from `semaphore`; false when `timeout` passed first.
  virtual bool wait(Semaphore& semaphore, std::chrono::nanoseconds timeout) = 0;
};

}  // namespace kel::platform
