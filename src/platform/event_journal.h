#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/work_queue.h"

namespace kel::platform {

/// A position in the journal; later events have larger ones. 0 is none.
using EventID = std::uint64_t;

/// Per-event flags; other bits say nothing that matters here.
namespace event_flags {
inline constexpr std::uint32_t mustScanSubDirectories = 0x1;  ///< changes below the path were coalesced
inline constexpr std::uint32_t eventIDsWrapped = 0x8;         ///< positions are no longer comparable
inline constexpr std::uint32_t historyDone = 0x10;            ///< the past was told; no change
}  // namespace event_flags

/// Flags for making a stream.
namespace stream_flags {
inline constexpr std::uint32_t pathObjects = 0x1;  ///< event paths come as string objects
inline constexpr std::uint32_t watchRoot = 0x4;    ///< tell also when a watched path itself moves or goes
}  // namespace stream_flags

struct JournalEvent {
  std::string path;
  std::uint32_t flags = 0;
  EventID eventID = 0;
};

/// One batch of events, on the stream's queue.
using JournalCallback = std::function<void(const std::vector<JournalEvent>&)>;

/// A stream over some paths. Released by destruction, after `invalidate`.
class JournalStream {
 public:
  virtual ~JournalStream() = default;

  /// The queue that events arrive on; before `start`. It outlives the stream.
  virtual void setQueue(SerialQueue& queue) = 0;

  /// Delivers the events since the stream's position, then one flagged history done, and no more. False when
  /// it cannot.
  virtual bool start() = 0;

  /// On the stream's queue: no further events are gathered.
  virtual void stop() = 0;

  /// On the stream's queue, or before `start` succeeded: no callback runs afterwards.
  virtual void invalidate() = 0;
};

/// The file-system event journal. Any thread.
class EventJournal {
 public:
  virtual ~EventJournal() = default;

  /// Names the directories, paths with a trailing "/", whose changes the journal is to know, beside those of
  /// the applications. Once, before anything else is asked; without it the journal knows of no change.
  virtual void watch(const std::vector<std::string>& serviceDirectories) = 0;

  /// The newest position; 0 when none can be given.
  virtual EventID currentEventID() = 0;

  /// A stream over `paths` from `since`, which calls `callback` (kept until the stream is destroyed) and
  /// holds events back for `latency` at most. Null when none can be made.
  virtual std::unique_ptr<JournalStream> createStream(JournalCallback callback,
                                                      const std::vector<std::string>& paths, EventID since,
                                                      std::chrono::nanoseconds latency,
                                                      std::uint32_t flags) = 0;
};

}  // namespace kel::platform
