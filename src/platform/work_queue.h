#pragma once

#include <chrono>
#include <cstddef>
#include <functional>
#include <memory>
#include <string>

#include "platform/annotations.h"

namespace kel::platform {

using Task = std::function<void()>;

class EventLoop;

/// Runs tasks one at a time, in the order they came, on a thread of its own that bears the queue's label.
///
/// Tasks may be handed over from any thread. Destroying the queue runs what was queued, drops timers that are
/// not due, and waits for the thread, unless the last task destroys it: then the thread ends after that task.
class KEL_CAPABILITY("queue") SerialQueue {
 public:
  explicit SerialQueue(std::string label);
  ~SerialQueue();
  SerialQueue(const SerialQueue&) = delete;
  SerialQueue& operator=(const SerialQueue&) = delete;

  const std::string& label() const;

  /// Queues `task` and returns at once.
  void async(Task task);

  /// Queues `task` and waits until it has run. Never called from the queue itself.
  void sync(const Task& task);

  /// Queues `task` when `delay` has passed; a delay that is not positive means at once.
  void after(std::chrono::nanoseconds delay, Task task);

  bool isCurrent() const;

  /// States that the caller runs on this queue; checked in debug builds.
  void assertCurrent() const KEL_ASSERTS_CAPABILITY(this);

  /// The loop of the queue's thread, for the platform's own event sources.
  EventLoop& loop();

 private:
  std::shared_ptr<EventLoop> loop_;
};

/// The shared pool: tasks run in parallel and in no order. One per process, as many threads as processors.
class ConcurrentQueue {
 public:
  ConcurrentQueue();
  ~ConcurrentQueue();
  ConcurrentQueue(const ConcurrentQueue&) = delete;
  ConcurrentQueue& operator=(const ConcurrentQueue&) = delete;

  /// Queues `task` and returns at once. Any thread.
  void async(Task task);

  /// Calls `work` with every index below `count`, in parallel, and returns when all calls have returned. The
  /// caller takes part, so that a call from a task of the pool cannot wait for itself. Any thread.
  void apply(std::size_t count, const std::function<void(std::size_t)>& work);

 private:
  struct Pool;
  std::shared_ptr<Pool> pool_;
};

/// Counts tasks under way. `wait` has no time limit.
class Group {
 public:
  Group();
  ~Group();

  /// Queues `task` on `queue` as one of the group.
  void async(ConcurrentQueue& queue, Task task);

  /// Returns when every task of the group has run.
  void wait();

 private:
  struct State;
  std::shared_ptr<State> state_;
};

/// A counting semaphore. Any thread.
class Semaphore {
 public:
  explicit Semaphore(std::size_t count = 0);
  ~Semaphore();

  void signal();

  /// Takes one, waiting up to `timeout` of real time; false when none came. Timed waits of the system go
  /// through `Clock::wait`, so that a test can let time pass.
  bool wait(std::chrono::nanoseconds timeout);

  /// As above, but gives up when `expired` is true; it is asked at the start and after every `poke`.
  bool waitUnless(const std::function<bool()>& expired);

  /// Makes waiters ask again.
  void poke();

 private:
  struct State;
  std::unique_ptr<State> state_;
};

}  // namespace kel::platform
