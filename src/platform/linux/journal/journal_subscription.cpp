#include "platform/linux/journal/journal_subscription.h"

namespace kel::platform {

void JournalSubscription::deliver(const std::shared_ptr<JournalSubscription>& subscription,
                                  std::vector<JournalEvent> events) {
  // Handed over while the subscription cannot be closed: its queue is still there.
  subscription->queue_.with([&](SerialQueue* queue) {
    if (!queue || events.empty()) return;
    queue->async([subscription, events = std::move(events)] {
      if (subscription->hasQueue()) subscription->callback_(events);
    });
  });
}

}  // namespace kel::platform
