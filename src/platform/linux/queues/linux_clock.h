#pragma once

#include "platform/clock.h"

namespace kel::platform {

/// The kernel's clocks: timers and waits follow the monotonic one, which nobody sets.
class LinuxClock : public Clock {
 public:
  double wallClockSeconds() const override;
  void after(SerialQueue& queue, std::chrono::nanoseconds delay, Task task) override;
  bool wait(Semaphore& semaphore, std::chrono::nanoseconds timeout) override;
};

}  // namespace kel::platform
