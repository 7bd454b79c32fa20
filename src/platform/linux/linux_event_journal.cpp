#include "platform/linux/linux_event_journal.h"

#include <algorithm>
#include <ctime>

namespace kel::platform {

EventID LinuxEventJournal::currentEventID() {
  timespec now{};
  clock_gettime(CLOCK_REALTIME_COARSE, &now);
  const EventID clock = static_cast<EventID>(now.tv_sec) * 1'000'000'000 + static_cast<EventID>(now.tv_nsec);
  EventID last = last_;
  while (!last_.compare_exchange_weak(last, std::max(last + 1, clock))) {
  }
  return std::max(last + 1, clock);
}

std::unique_ptr<JournalStream> LinuxEventJournal::createStream(JournalCallback,
                                                               const std::vector<std::string>&, EventID,
                                                               std::chrono::nanoseconds, std::uint32_t) {
  return nullptr;
}

}  // namespace kel::platform
