// The work queues of the simulation. Every serial queue is a thread of the scheduler, the pool is two; which
// of them runs its next task is drawn. What belongs to a killed process drops what it is given.

#include <algorithm>
#include <deque>
#include <map>
#include <stdexcept>
#include <utility>
#include <vector>

#include "platform/work_queue.h"
#include "simulation/scheduler.h"

namespace kel::platform {

using simulation::Scheduler;
using simulation::Time;

namespace {

struct QueueState {
  QueueState(std::string queueLabel, int queueDepth) : label(std::move(queueLabel)), depth(queueDepth) {}

  bool hasWork() const { return !tasks.empty() || isFinishing || nextTimer() <= Scheduler::current().now(); }
  Time nextTimer() const { return timers.empty() ? simulation::never : timers.begin()->first; }

  /// A thread of the queue: until there is nothing left and the queue is gone.
  static void run(const std::shared_ptr<QueueState>& state, bool isSerial = true) {
    Scheduler& scheduler = Scheduler::current();
    if (isSerial) scheduler.serve(state.get());
    for (;;) {
      scheduler.wait([&state] { return state->hasWork(); }, [&state] { return state->nextTimer(); });
      while (state->nextTimer() <= scheduler.now()) {
        state->tasks.push_back(std::move(state->timers.begin()->second));
        state->timers.erase(state->timers.begin());
      }
      if (state->tasks.empty()) break;
      const Task task = std::move(state->tasks.front());
      state->tasks.pop_front();
      task();
    }
    state->hasEnded = true;
  }

  const std::string label;
  const int depth;
  std::deque<Task> tasks;
  std::multimap<Time, Task> timers;
  bool isFinishing = false;
  bool hasEnded = false;
};

}  // namespace

struct SerialQueue::Body {
  const std::shared_ptr<QueueState> state;
};

SerialQueue::SerialQueue(std::string label, int depth)
    : body_(new Body{std::make_shared<QueueState>(std::move(label), depth)}) {
  Scheduler::current().spawn(this->label(), [state = body_->state] { QueueState::run(state); });
}

SerialQueue::~SerialQueue() {
  QueueState& state = *body_->state;
  state.timers.clear();
  state.isFinishing = true;
  if (!isCurrent()) Scheduler::current().waitWithoutThrowing([&state] { return state.hasEnded; });
}

const std::string& SerialQueue::label() const { return body_->state->label; }

void SerialQueue::async(Task task) { body_->state->tasks.push_back(std::move(task)); }

void SerialQueue::sync(const Task& task) {
  const auto* waiting = static_cast<const QueueState*>(Scheduler::current().served());
  if (waiting && waiting->depth >= body_->state->depth) {
    throw std::logic_error(waiting->label + " waits for " + label());
  }
  const auto done = std::make_shared<bool>(false);
  async([&task, done] {
    task();
    *done = true;
  });
  Scheduler::current().wait([done] { return *done; });
}

void SerialQueue::after(std::chrono::nanoseconds delay, Task task) {
  if (delay <= std::chrono::nanoseconds::zero()) return async(std::move(task));
  body_->state->timers.emplace(Scheduler::current().now() + delay, std::move(task));
}

bool SerialQueue::isCurrent() const { return Scheduler::current().served() == body_->state.get(); }

void SerialQueue::assertCurrent() const {
  if (!isCurrent()) throw std::logic_error("not on " + label());
}

struct ConcurrentQueue::Pool : QueueState {
  using QueueState::QueueState;
};

ConcurrentQueue::ConcurrentQueue() : pool_(std::make_shared<Pool>("pool", SerialQueue::deepest)) {
  for (int thread = 0; thread < 2; ++thread) {
    Scheduler::current().spawn("pool", [pool = pool_] { QueueState::run(pool, false); });
  }
}

ConcurrentQueue::~ConcurrentQueue() { pool_->isFinishing = true; }

void ConcurrentQueue::async(Task task) { pool_->tasks.push_back(std::move(task)); }

void ConcurrentQueue::apply(std::size_t count, const std::function<void(std::size_t)>& work) {
  struct Application {
    std::size_t next = 0;
    std::size_t done = 0;
  };
  const auto application = std::make_shared<Application>();
  const auto takePart = [application, count, &work] {
    while (application->next < count) {
      const std::size_t index = application->next++;
      Scheduler::current().yield();
      work(index);
      ++application->done;
    }
  };
  for (std::size_t helper = 1; helper < std::min<std::size_t>(count, 3); ++helper) async(takePart);
  takePart();
  Scheduler::current().wait([application, count] { return application->done == count; });
}

struct Group::State {
  std::size_t underWay = 0;
};

Group::Group() : state_(std::make_shared<State>()) {}
Group::~Group() = default;

void Group::async(ConcurrentQueue& queue, Task task) {
  ++state_->underWay;
  queue.async([state = state_, task = std::move(task)]() mutable {
    task();
    task = nullptr;
    --state->underWay;
  });
}

void Group::wait() {
  Scheduler::current().wait([state = state_] { return state->underWay == 0; });
}

struct Semaphore::State {
  std::size_t count = 0;
};

Semaphore::Semaphore(std::size_t count) : state_(std::make_unique<State>(State{count})) {}
Semaphore::~Semaphore() = default;

void Semaphore::signal() { ++state_->count; }

bool Semaphore::wait(std::chrono::nanoseconds timeout) {
  const bool taken = Scheduler::current().wait([this] { return state_->count > 0; }, timeout);
  if (taken && state_->count > 0) --state_->count;
  return taken;
}

}  // namespace kel::platform
