#pragma once

#include <atomic>

#include "platform/event_journal.h"

namespace kel::platform {

/// A journal that counts positions and remembers no events: it can make no stream, so that whoever asks what
/// changed is told nothing and has to look at everything anew. Without an index every update is a full
/// rescan. Any thread.
class LinuxEventJournal final : public EventJournal {
 public:
  /// The coarse real-time clock in nanoseconds, but always past every position given before.
  EventID currentEventID() override;

  std::unique_ptr<JournalStream> createStream(JournalCallback callback, const std::vector<std::string>& paths,
                                              EventID since, std::chrono::nanoseconds latency,
                                              std::uint32_t flags) override;

 private:
  std::atomic<EventID> last_ = 0;
};

}  // namespace kel::platform
