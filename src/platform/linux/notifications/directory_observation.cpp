#include "platform/linux/notifications/directory_observation.h"

#include <array>
#include <cerrno>
#include <cstring>
#include <sys/epoll.h>
#include <sys/inotify.h>
#include <unistd.h>

#include "platform/linux/files/files.h"
#include "platform/linux/queues/serial_queue.h"
#include "platform/linux/queues/while_alive.h"

namespace kel::platform {

// No post slips through: the kernel's watch comes first and the count is read second, so a post is either in
// that count's successor or in an event. Events only say "look": what counts is whether the count differs
// from the last one seen, so a lost or repeated event does no harm.
class DirectoryObservation::Watcher : public std::enable_shared_from_this<Watcher> {
 public:
  Watcher(const NotificationStore& store, std::string name, SerialQueue& queue, std::function<void()> posted,
          SystemLog& log)
      : store_(store.directory()),
        name_(std::move(name)),
        keptLoop_(eventLoop(queue).shared_from_this()),
        loop_(*keptLoop_),
        posted_(std::move(posted)),
        log_(log) {}

  std::optional<std::string> start() {
    inotify_ = OwnedDescriptor(inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
    if (!inotify_ || !watchDirectory()) return errorLine(store_.directory(), errno);
    const auto record = store_.read(name_);
    loop_.async([self = shared_from_this(), seen = record ? record->posts : 0] {
      self->loop_.assertCurrent();
      self->listen(seen);
    });
    return std::nullopt;
  }

  void stop() {
    loop_.assertCurrent();
    stopped_ = true;
    watch_.reset();
  }

 private:
  bool watchDirectory() {
    constexpr std::uint32_t events =
        IN_MOVED_TO | IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR | IN_DONT_FOLLOW;
    return store_.prepareDirectory() &&
           inotify_add_watch(inotify_.get(), store_.directory().c_str(), events) >= 0;
  }

  void listen(std::uint64_t seen) KEL_RUNS_ON(loop_) {
    if (stopped_) return;
    lastSeen_ = seen;
    watch_ = loop_.watch(inotify_.get(), EPOLLIN, whileAlive(weak_from_this(), loop_, &Watcher::look));
    if (!watch_) log_.write("Cannot watch notifications: " + errorLine(store_.directory(), errno));
  }

  void look() KEL_RUNS_ON(loop_) {
    // Where the directory itself went away its successor is watched, before the count is read.
    if (drain()) watchDirectory();
    const auto record = store_.read(name_);
    if (!record || record->posts == 0 || record->posts == lastSeen_) return;
    lastSeen_ = record->posts;
    posted_();
  }

  /// Takes what the kernel holds; true when the directory is no longer the one watched.
  bool drain() {
    bool isGone = false;
    alignas(inotify_event) std::array<char, 4096> buffer;
    const ssize_t length = read(inotify_.get(), buffer.data(), buffer.size());
    for (ssize_t at = 0; at < length;) {
      inotify_event event;
      std::memcpy(&event, &buffer[static_cast<std::size_t>(at)], sizeof event);
      isGone |= (event.mask & (IN_DELETE_SELF | IN_MOVE_SELF | IN_IGNORED)) != 0;
      at += static_cast<ssize_t>(sizeof event + event.len);
    }
    return isGone;
  }

  // Fixed after construction; `inotify_` once `start` has handed over to the loop.
  const NotificationStore store_;
  const std::string name_;
  const std::shared_ptr<EventLoop> keptLoop_;
  EventLoop& loop_;
  const std::function<void()> posted_;
  SystemLog& log_;
  OwnedDescriptor inotify_;

  std::uint64_t lastSeen_ KEL_ON(loop_) = 0;
  bool stopped_ KEL_ON(loop_) = false;
  std::unique_ptr<EventLoop::Watch> watch_ KEL_ON(loop_);
};

DirectoryObservation::DirectoryObservation(const NotificationStore& store, std::string name,
                                           SerialQueue& queue, std::function<void()> posted, SystemLog& log)
    : watcher_(std::make_shared<Watcher>(store, std::move(name), queue, std::move(posted), log)) {}

DirectoryObservation::~DirectoryObservation() { watcher_->stop(); }

std::optional<std::string> DirectoryObservation::start() { return watcher_->start(); }

}  // namespace kel::platform
