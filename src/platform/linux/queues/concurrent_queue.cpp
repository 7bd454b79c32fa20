#include <algorithm>
#include <atomic>
#include <condition_variable>
#include <deque>
#include <mutex>
#include <thread>
#include <utility>
#include <vector>

#include "platform/linux/queues/thread.h"
#include "platform/work_queue.h"

namespace kel::platform {

struct ConcurrentQueue::Pool {
  void run() {
    std::unique_lock lock(mutex);
    for (;;) {
      arrived.wait(lock, [this] { return finishing || !tasks.empty(); });
      if (tasks.empty()) return;
      Task task = std::move(tasks.front());
      tasks.pop_front();
      lock.unlock();
      task();
      task = nullptr;
      lock.lock();
    }
  }

  std::mutex mutex;
  std::condition_variable arrived;
  std::deque<Task> tasks;
  bool finishing = false;
  std::vector<std::thread> threads;
};

ConcurrentQueue::ConcurrentQueue() : pool_(std::make_shared<Pool>()) {
  const unsigned count = std::max(2U, std::thread::hardware_concurrency());
  for (unsigned i = 0; i < count; ++i) {
    pool_->threads.push_back(startThread("kel worker", [pool = pool_] { pool->run(); }));
  }
}

ConcurrentQueue::~ConcurrentQueue() {
  {
    const std::lock_guard lock(pool_->mutex);
    pool_->finishing = true;
  }
  pool_->arrived.notify_all();
  for (std::thread& thread : pool_->threads) {
    if (thread.get_id() == std::this_thread::get_id()) {
      thread.detach();
    } else {
      thread.join();
    }
  }
}

void ConcurrentQueue::async(Task task) {
  {
    const std::lock_guard lock(pool_->mutex);
    pool_->tasks.push_back(std::move(task));
  }
  pool_->arrived.notify_one();
}

namespace {

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
    const std::lock_guard lock(mutex);
    done += performed;
    if (done == count) finished.notify_all();
  }

  void awaitOthers() {
    std::unique_lock lock(mutex);
    finished.wait(lock, [this] { return done == count; });
  }

  const std::size_t count;
  const std::function<void(std::size_t)>& work;
  std::atomic<std::size_t> next = 0;
  std::mutex mutex;
  std::condition_variable finished;
  std::size_t done = 0;
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
  std::mutex mutex;
  std::condition_variable finished;
  std::size_t underWay = 0;
};

Group::Group() : state_(std::make_shared<State>()) {}
Group::~Group() = default;

void Group::async(ConcurrentQueue& queue, Task task) {
  {
    const std::lock_guard lock(state_->mutex);
    ++state_->underWay;
  }
  queue.async([state = state_, task = std::move(task)]() mutable {
    task();
    // What the task holds is let go of before it counts as done.
    task = nullptr;
    const std::lock_guard lock(state->mutex);
    if (--state->underWay == 0) state->finished.notify_all();
  });
}

void Group::wait() {
  std::unique_lock lock(state_->mutex);
  state_->finished.wait(lock, [this] { return state_->underWay == 0; });
}

}  // namespace kel::platform
