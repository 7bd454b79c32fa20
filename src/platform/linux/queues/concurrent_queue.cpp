#include <algorithm>
#include <atomic>
#include <deque>
#include <optional>
#include <thread>
#include <utility>
#include <vector>

#include "platform/linux/queues/monitor.h"
#include "platform/linux/queues/thread.h"
#include "platform/work_queue.h"

// How `apply` ends, wherever it is called. A caller that only waited would hold up a pool whose threads all
// call `apply` from their tasks: each would wait for tasks that no thread is left to run. So the caller draws
// indices too, and could do all of the work alone; the tasks it queues are an offer to whoever is free. They
// share one counter, from which everybody draws the next index, so that a slow call holds up nobody else's
// share.
//
// The caller returns when every index is done. It waits for calls that some thread is in the middle of, never
// for a task in the queue. Those of its tasks that begin later find no index left and go. The state they look
// at is shared for their sake; the work itself is the caller's, and nobody without an index touches it.
//
// Never happens: a wait in a circle, as a call waits only for calls that began after it, further down; a
// result that the caller does not see, as each participant adds to `done` under the lock that the caller
// takes to read it.
namespace kel::platform {

struct ConcurrentQueue::Pool {
  struct Inbox {
    std::deque<Task> tasks;
    bool finishing = false;
  };
  using Wake = Monitor<Inbox>::Wake;

  void run() {
    while (const std::optional<Task> task = next()) (*task)();
  }

  /// Waits for a task; absent when the queue has ended and all are run.
  std::optional<Task> next() {
    return inbox.when([](const Inbox& now) { return now.finishing || !now.tasks.empty(); },
                      [](Inbox& now) -> std::optional<Task> {
                        if (now.tasks.empty()) return std::nullopt;
                        std::optional<Task> task = std::move(now.tasks.front());
                        now.tasks.pop_front();
                        return task;
                      });
  }

  Monitor<Inbox> inbox;
  std::vector<std::thread> threads;  // fixed between construction and destruction of the queue
};

ConcurrentQueue::ConcurrentQueue() : pool_(std::make_shared<Pool>()) {
  const unsigned count = std::max(2U, std::thread::hardware_concurrency());
  for (unsigned i = 0; i < count; ++i) {
    pool_->threads.push_back(startThread("kel worker", [pool = pool_] { pool->run(); }));
  }
}

ConcurrentQueue::~ConcurrentQueue() {
  pool_->inbox.change([](Pool::Inbox& inbox) {
    inbox.finishing = true;
    return Pool::Wake::All;
  });
  for (std::thread& thread : pool_->threads) {
    if (thread.get_id() == std::this_thread::get_id()) {
      thread.detach();
    } else {
      thread.join();
    }
  }
}

void ConcurrentQueue::async(Task task) {
  pool_->inbox.change([&task](Pool::Inbox& inbox) {
    inbox.tasks.push_back(std::move(task));
    return Pool::Wake::One;
  });
}

namespace {

using Count = Monitor<std::size_t>;

/// One `apply`: whoever takes part draws the next index until none is left. Shared with the pool's tasks,
/// some of which may begin only when the call has long returned; they find no index and never touch `work`.
struct Application {
  Application(std::size_t number, const std::function<void(std::size_t)>& each) : count(number), work(each) {}

  void takePart() {
    std::size_t performed = 0;
    for (std::size_t index = next++; index < count; index = next++) {
      work(index);
      ++performed;
    }
    if (performed == 0) return;
    done.change([&](std::size_t& number) {
      number += performed;
      return number == count ? Count::Wake::All : Count::Wake::Nobody;
    });
  }

  void awaitOthers() {
    done.await([this](std::size_t number) { return number == count; });
  }

  const std::size_t count;
  const std::function<void(std::size_t)>& work;
  std::atomic<std::size_t> next = 0;
  Count done;
};

}  // namespace

void ConcurrentQueue::apply(std::size_t count, const std::function<void(std::size_t)>& work) {
  if (count == 0) return;
  const auto application = std::make_shared<Application>(count, work);
  const std::size_t helpers = std::min(count - 1, pool_->threads.size());
  for (std::size_t i = 0; i < helpers; ++i) async([application] { application->takePart(); });
  application->takePart();
  application->awaitOthers();
}

struct Group::State {
  Count underWay;
};

Group::Group() : state_(std::make_shared<State>()) {}
Group::~Group() = default;

void Group::async(ConcurrentQueue& queue, Task task) {
  state_->underWay.change([](std::size_t& number) {
    ++number;
    return Count::Wake::Nobody;
  });
  queue.async([state = state_, task = std::move(task)]() mutable {
    task();
    // What the task holds is let go of before it counts as done.
    task = nullptr;
    state->underWay.change(
        [](std::size_t& number) { return --number == 0 ? Count::Wake::All : Count::Wake::Nobody; });
  });
}

void Group::wait() {
  state_->underWay.await([](std::size_t number) { return number == 0; });
}

}  // namespace kel::platform
