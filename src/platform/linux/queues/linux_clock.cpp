#include "platform/linux/queues/linux_clock.h"

#include <utility>

namespace kel::platform {

double LinuxClock::wallClockSeconds() const {
  return std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();
}

void LinuxClock::after(SerialQueue& queue, std::chrono::nanoseconds delay, Task task) {
  queue.after(delay, std::move(task));
}

bool LinuxClock::wait(Semaphore& semaphore, std::chrono::nanoseconds timeout) {
  return semaphore.wait(timeout);
}

}  // namespace kel::platform
