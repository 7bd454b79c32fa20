#include "platform/linux/registry/linux_launch_events.h"

#include <chrono>
#include <string>
#include <utility>

namespace kel::platform {

namespace {

/// Posts the registry's notification, once a second at most however much changes. Used on one queue.
class DatabaseChangePoster : public std::enable_shared_from_this<DatabaseChangePoster> {
 public:
  DatabaseChangePoster(NotificationSeeds& seeds, SerialQueue& queue) : seeds_(seeds), queue_(queue) {}

  void note() {
    queue_.assertCurrent();
    constexpr std::chrono::seconds pause{1};
    if (std::exchange(isPending_, true)) return;
    const auto due = last_ + pause - std::chrono::steady_clock::now();
    queue_.after(due, [self = shared_from_this()] {
      self->queue_.assertCurrent();
      self->isPending_ = false;
      self->last_ = std::chrono::steady_clock::now();
      self->seeds_.post(databaseChangeNotification);
    });
  }

 private:
  NotificationSeeds& seeds_;
  SerialQueue& queue_;
  bool isPending_ KEL_ON(queue_) = false;
  std::chrono::steady_clock::time_point last_ KEL_ON(queue_);
};

}  // namespace

LinuxLaunchEvents::~LinuxLaunchEvents() {
  if (isWatching_) journal_.start({});
  for (Source& source : sources_) {
    const auto stop = [&source] { source.observation.reset(); };
    if (source.queue.isCurrent()) {
      stop();
    } else {
      source.queue.sync(stop);
    }
  }
}

void LinuxLaunchEvents::setHandler(std::string_view stream, SerialQueue& queue,
                                   std::function<void()> handler) {
  if (stream == launch_streams::databaseChanges) {
    sources_.push_back({queue, seeds_.observe(databaseChangeNotification, queue, handler)});
  } else if (stream == launch_streams::seedingComplete) {
    // Whoever started the server waits for a first answer, which needs the processors more.
    constexpr std::chrono::seconds pause{1};
    queue.after(pause, [&applications = applications_, &queue, handler] {
      applications.seed([&queue, handler] { queue.async(handler); });
    });
  } else if (stream == launch_streams::directoryChanges) {
    watch(queue, handler);
  } else {
    return log_.write("There is no launch-event stream " + std::string(stream));
  }
  queue.async(std::move(handler));
}

void LinuxLaunchEvents::watch(SerialQueue& queue, std::function<void()> handler) {
  const auto poster = std::make_shared<DatabaseChangePoster>(seeds_, queue);
  isWatching_ = journal_.start([&queue, poster, handler = std::move(handler)](JournalForest::Hints changed) {
    if (changed.applications) queue.async([poster] { poster->note(); });
    queue.async(handler);
  });
}

}  // namespace kel::platform
