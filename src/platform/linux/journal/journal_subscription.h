#pragma once

#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "platform/event_journal.h"
#include "platform/guarded.h"
#include "platform/work_queue.h"

namespace kel::platform {

/// One reader of the journal. Its callback runs on its own queue, and never after `close`.
class JournalSubscription {
 public:
  JournalSubscription(JournalCallback callback, std::vector<std::string> paths, EventID since,
                      bool watchesRoot)
      : callback_(std::move(callback)),
        paths_(std::move(paths)),
        watchesRoot_(watchesRoot),
        position_(since) {}

  /// Before the first event.
  void setQueue(SerialQueue& queue) { queue_.set(&queue); }
  bool hasQueue() const { return queue_.copy() != nullptr; }

  /// On the subscription's queue, or before the first event.
  void close() { queue_.set(nullptr); }

  const std::vector<std::string>& paths() const { return paths_; }
  bool watchesRoot() const { return watchesRoot_; }

  /// The position up to which events were delivered; only on the journal's queue.
  EventID position() const { return position_; }

  /// On the journal's queue; the events reach up to `position`. False when it was closed.
  static bool deliver(const std::shared_ptr<JournalSubscription>& subscription,
                      std::vector<JournalEvent> events, EventID position);

 private:
  const JournalCallback callback_;
  const std::vector<std::string> paths_;
  const bool watchesRoot_;
  EventID position_;
  Guarded<SerialQueue*> queue_;
};

}  // namespace kel::platform
