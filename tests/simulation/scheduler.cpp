#include "simulation/scheduler.h"

#include <exception>
#include <stdexcept>
#include <utility>
#include <vector>

namespace kel::simulation {

namespace {

Scheduler*& only() {
  static Scheduler* scheduler = nullptr;
  return scheduler;
}

}  // namespace

struct Scheduler::Thread {
  Thread(std::string threadName, std::shared_ptr<Process> owner, std::function<void()> body)
      : name(std::move(threadName)), process(std::move(owner)), fiber(std::move(body)) {}

  bool canGo(Time now) const { return !condition || condition() || deadline() <= now; }

  const std::string name;
  const std::shared_ptr<Process> process;
  std::function<bool()> condition;  // none: it only let others go first
  std::function<Time()> deadline;
  const void* served = nullptr;
  KELDebugSink sink;  // what would be the thread's own in a program of several threads
  Fiber fiber;
};

Scheduler::Scheduler(std::uint64_t seed) : random_(seed) { only() = this; }

Scheduler::~Scheduler() { only() = nullptr; }

Scheduler& Scheduler::current() { return *only(); }

std::shared_ptr<Process> Scheduler::process() const { return running_ ? running_->process : nullptr; }

void Scheduler::spawn(std::string name, std::function<void()> body, std::shared_ptr<Process> process) {
  auto guarded = [this, body = std::move(body)] {
    try {
      if (!running_->process->isKilled) body();
    } catch (const Killed&) {
    } catch (...) {
      if (!failure_) failure_ = std::current_exception();
    }
  };
  if (!process) process = running_->process;
  threads_.push_back(std::make_unique<Thread>(std::move(name), std::move(process), std::move(guarded)));
}

void Scheduler::run() {
  std::vector<Thread*> ready;
  for (;;) {
    unwindKilled();
    ready.clear();
    Time next = never;
    for (const auto& thread : threads_) {
      if (thread->canGo(now_)) {
        ready.push_back(thread.get());
      } else {
        next = std::min(next, thread->deadline());
      }
    }
    if (!ready.empty()) {
      resume(*ready[draw(ready.size())]);
    } else if (next == never) {
      return;
    } else {
      now_ = next;
    }
    if (failure_) std::rethrow_exception(std::exchange(failure_, nullptr));
    reap();
  }
}

void Scheduler::resume(Thread& thread) {
  running_ = &thread;
  set_current_debug_sink(std::move(thread.sink));
  thread.fiber.resume();
  thread.sink = current_debug_sink();
  set_current_debug_sink(nullptr);
  running_ = nullptr;
}

void Scheduler::reap() {
  std::erase_if(threads_, [](const auto& thread) { return thread->fiber.hasEnded(); });
}

void Scheduler::kill(Process& process) {
  process.isKilled = true;
  if (!running_) return unwindKilled();
  // Whoever runs next is the scheduler, which unwinds before it lets anybody go on.
  yield();
}

void Scheduler::unwindKilled() {
  for (auto thread = threads_.rbegin(); thread != threads_.rend(); ++thread) {
    while ((*thread)->process->isKilled && !(*thread)->fiber.hasEnded()) resume(**thread);
  }
  reap();
}

void Scheduler::yield() {
  wait(nullptr, [] { return never; });
}

bool Scheduler::wait(std::function<bool()> condition, Time timeout) {
  const Time end = timeout > never - now_ ? never : now_ + timeout;
  return wait(std::move(condition), [end] { return end; });
}

bool Scheduler::wait(std::function<bool()> condition, std::function<Time()> deadline) {
  const bool held = suspend(std::move(condition), std::move(deadline));
  if (running_ && running_->process->isKilled && std::uncaught_exceptions() == 0) throw Killed();
  return held;
}

void Scheduler::waitWithoutThrowing(std::function<bool()> condition) {
  suspend(std::move(condition), [] { return never; });
}

bool Scheduler::suspend(std::function<bool()> condition, std::function<Time()> deadline) {
  // Outside every thread nothing can be waited for: what is built and torn down there waits for nobody.
  if (!running_ || running_->process->isKilled) return true;
  Thread& self = *running_;
  self.condition = std::move(condition);
  self.deadline = std::move(deadline);
  Fiber::suspend();
  const bool held = !self.condition || self.condition();
  self.condition = nullptr;
  return held;
}

const void* Scheduler::served() const { return running_ ? running_->served : nullptr; }

void Scheduler::serve(const void* queue) { running_->served = queue; }

std::string Scheduler::waiting() const {
  std::string lines;
  for (const auto& thread : threads_) lines += thread->process->name + ": " + thread->name + "\n";
  return lines;
}

}  // namespace kel::simulation
