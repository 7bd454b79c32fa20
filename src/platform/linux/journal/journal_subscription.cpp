#include "platform/linux/journal/journal_subscription.h"

namespace kel::platform {

bool JournalSubscription::deliver(const std::shared_ptr<JournalSubscription>& subscription,
                                  std::vector<JournalEvent> events, EventID position) {
  subscription->position_ = position;
  // Handed over while the subscription cannot be closed: its queue is still there.
  return subscription->queue_.with([&](SerialQueue* queue) {
    if (!queue) return false;
    if (events.empty()) return true;
    queue->async([subscription, events = std::move(events)] {
      if (subscription->hasQueue()) subscription->callback_(events);
    });
    return true;
  });
}

}  // namespace kel::platform
