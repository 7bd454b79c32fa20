#pragma once

#include <chrono>
#include <cstddef>
#include <functional>
#include <limits>
#include <memory>
#include <string>

#include "platform/annotations.h"

namespace kel::platform {

// Work queues are made wherever work is ordered, so they are no virtual services that are handed down: these
// classes are the seam, and the platform that is linked in defines their bodies. A test may link in others.

using Task = std::function<void()>;

/// Runs tasks one at a time, in the order they came, on a thread of its own that bears the queue's label.
///
/// Waiting runs one way: a queue waits, in `sync`, only for deeper ones, so that no two can wait for each
/// other.
///
/// Tasks may be handed over from any thread. Destroying the queue runs what was queued, drops timers that are
/// not due, and waits for the thread, unless the last task destroys it: then the thread ends after that task.
class KEL_CAPABILITY("queue") SerialQueue {
 public:
  /// The depth of a queue that waits for none.
  static constexpr int deepest = std::numeric_limits<int>::max();

  explicit SerialQueue(std::string label, int depth = deepest);
  ~SerialQueue();
  SerialQueue(const SerialQueue&) = delete;
  SerialQueue& operator=(const SerialQueue&) = delete;

  const std::string& label() const;

  /// Queues `task` and returns at once.
  void async(Task task);

  /// Queues `task` and waits until it has run. From no queue, or from one that lies less deep; checked in
  /// debug builds.
  void sync(const Task& task);

  /// Queues `task` when `delay` has passed; a delay that is not positive means at once.
  void after(std::chrono::nanoseconds delay, Task task);

  bool isCurrent() const;

  /// States that the caller runs on this queue; checked in debug builds.
  void assertCurrent() const KEL_ASSERTS_CAPABILITY(this);

  /// What the linked-in platform makes a queue of; for its own event sources.
  struct Body;
  Body& body() { return *body_; }

 private:
  const std::unique_ptr<Body> body_;
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

 private:
  struct State;
  std::unique_ptr<State> state_;
};

}  // namespace kel::platform
