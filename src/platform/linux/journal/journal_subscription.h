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
      : callback_(std::move(callback)), paths_(std::move(paths)), since_(since), watchesRoot_(watchesRoot) {}

  /// Before the first event.
  void setQueue(SerialQueue& queue) { queue_.set(&queue); }
  bool hasQueue() const { return queue_.copy() != nullptr; }

  /// On the subscription's queue, or before the first event.
  void close() { queue_.set(nullptr); }

  const std::vector<std::string>& paths() const { return paths_; }
  EventID since() const { return since_; }
  bool watchesRoot() const { return watchesRoot_; }

  /// Hands the events to the subscription's queue, unless it was closed. Any thread.
  static void deliver(const std::shared_ptr<JournalSubscription>& subscription,
                      std::vector<JournalEvent> events);

 private:
  const JournalCallback callback_;
  const std::vector<std::string> paths_;
  const EventID since_;
  const bool watchesRoot_;
  Guarded<SerialQueue*> queue_;
};

}  // namespace kel::platform
