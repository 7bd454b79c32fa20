#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <thread>
#include <unordered_map>

#include "platform/annotations.h"
#include "platform/guarded.h"
#include "platform/linux/files/owned_descriptor.h"
#include "platform/work_queue.h"

namespace kel::platform {

/// What a serial queue's thread does: it waits in one epoll set for tasks, timers and descriptors.
///
/// Tasks run in the order they came; a timer that falls due becomes a task. Between tasks the descriptors
/// that are ready are served. Always held by a shared_ptr, by the queue, its thread and its descriptor
/// watches.
class KEL_CAPABILITY("loop") EventLoop : public std::enable_shared_from_this<EventLoop> {
 public:
  using TimePoint = std::chrono::steady_clock::time_point;
  using Callback = std::function<void(std::uint32_t events)>;

  /// A descriptor that the loop watches until the watch is destroyed, also during a callback (its own
  /// included): after that no call starts. On the loop's thread, or after it has ended.
  class Watch {
   public:
    Watch(std::shared_ptr<EventLoop> loop, std::uint64_t id, int descriptor)
        : loop_(std::move(loop)), id_(id), descriptor_(descriptor) {}
    ~Watch() { loop_->unwatch(id_, descriptor_); }
    Watch(const Watch&) = delete;
    Watch& operator=(const Watch&) = delete;

    /// Watches for these epoll events from now on; hang-ups and errors are always reported.
    void setEvents(std::uint32_t events) { loop_->change(id_, descriptor_, events); }

   private:
    const std::shared_ptr<EventLoop> loop_;
    const std::uint64_t id_;
    const int descriptor_;
  };

  /// Throws std::system_error when the process is out of descriptors.
  explicit EventLoop(std::string label);
  EventLoop(const EventLoop&) = delete;
  EventLoop& operator=(const EventLoop&) = delete;

  const std::string& label() const { return label_; }

  /// Starts the thread. Once; throws std::system_error when the system has no thread left.
  void start();

  /// Lets the thread end when every task has run, and waits for that unless the caller is that thread. Timers
  /// that are not due then and the callbacks of watches are destroyed on the thread. Once, after `start`.
  void finish();

  // Any thread. When the loop's thread has ended, tasks are dropped.
  void async(Task task);
  void after(std::chrono::nanoseconds delay, Task task);

  bool isCurrent() const;

  /// States that the caller may touch what belongs to the loop: it runs on the loop's thread, or that thread
  /// has ended, so that nobody else runs there. Checked in debug builds.
  void assertCurrent() const KEL_ASSERTS_CAPABILITY(this);

  /// Calls `callback` with the epoll events of `descriptor`, which stays open while it is watched, as long as
  /// it is ready for `events`. Null, with errno set, when the kernel refuses. On the loop's thread.
  [[nodiscard]] std::unique_ptr<Watch> watch(int descriptor, std::uint32_t events, Callback callback);

 private:
  struct Inbox {
    std::deque<Task> tasks;
    std::multimap<TimePoint, Task> timers;
    bool asleep = false;  // the thread waits, or is about to, and must be woken for what is new
    bool finishing = false;
    bool ended = false;
  };

  struct Round {
    std::deque<Task> tasks;
    int waitMilliseconds = 0;
    bool finished = false;
  };

  void run();
  Round nextRound();
  void serveDescriptors(int waitMilliseconds) KEL_RUNS_ON(this);
  void dropEverything() KEL_RUNS_ON(this);
  void wake();
  bool epollControl(int operation, int descriptor, std::uint32_t events, std::uint64_t id);
  void change(std::uint64_t id, int descriptor, std::uint32_t events);
  void unwatch(std::uint64_t id, int descriptor);

  const std::string label_;
  const OwnedDescriptor epoll_;
  const OwnedDescriptor wakeUp_;
  std::thread thread_;  // only touched by `start` and `finish`
  Guarded<Inbox> inbox_;
  std::atomic<bool> ended_ = false;

  // Only on the loop's thread. Identities are never reused, so that an event that was fetched for a watch
  // which is gone meanwhile finds nothing.
  std::unordered_map<std::uint64_t, std::shared_ptr<const Callback>> callbacks_ KEL_ON(this);
  std::uint64_t lastWatch_ KEL_ON(this) = 0;
};

}  // namespace kel::platform
