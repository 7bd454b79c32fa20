#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <limits>
#include <list>
#include <memory>
#include <random>
#include <string>

#include "common/debug_sink.h"
#include "simulation/fiber.h"

namespace kel::simulation {

using Time = std::chrono::nanoseconds;  ///< virtual, since the start of the history
inline constexpr Time never = Time::max();

/// What ends together when it is killed: a server, or all that goes on around it.
struct Process {
  std::string name;
  bool isKilled = false;
};

/// One history: threads of execution of which one runs at a time, and a number that decides which goes next.
///
/// A thread runs until it waits or yields; then any other that can go is drawn. When none can, time jumps to
/// the next deadline; when there is none either, the world is still.
class Scheduler {
 public:
  explicit Scheduler(std::uint64_t seed);
  ~Scheduler();  ///< after `kill` of every process
  Scheduler(const Scheduler&) = delete;
  Scheduler& operator=(const Scheduler&) = delete;

  /// The one there is.
  static Scheduler& current();

  /// A number below `bound`.
  std::uint64_t draw(std::uint64_t bound) {
    return std::uniform_int_distribution<std::uint64_t>(0, bound - 1)(random_);
  }
  bool oneIn(std::uint64_t count) { return draw(count) == 0; }

  Time now() const { return now_; }

  /// Starts a thread of the process that the caller belongs to, or of `process`.
  void spawn(std::string name, std::function<void()> body, std::shared_ptr<Process> process = nullptr);

  /// Runs until the world is still. Throws what a thread threw.
  void run();

  /// Ends the process where it stands: its threads are unwound, the youngest first, and nobody else runs
  /// meanwhile. From a thread of another process, or when none runs.
  void kill(Process& process);

  /// The process of the running thread.
  std::shared_ptr<Process> process() const;

  // For the running thread. When its process was killed they throw, or return at once while it is unwound.

  /// Lets others go first.
  void yield();

  /// Waits until `condition` holds, or until the time that `deadline` gives: then false.
  bool wait(std::function<bool()> condition, std::function<Time()> deadline);
  bool wait(std::function<bool()> condition, Time timeout = never);
  /// For destructors: when the process was killed it goes on instead of throwing, up to the next wait.
  void waitWithoutThrowing(std::function<bool()> condition);
  void sleep(Time duration) {
    wait([] { return false; }, duration);
  }

  /// What the running thread serves, as `serve` said; null for nothing, and when no thread runs.
  const void* served() const;
  void serve(const void* queue);

  /// Who waits now, a line each.
  std::string waiting() const;

 private:
  struct Killed {};
  struct Thread;

  bool suspend(std::function<bool()> condition, std::function<Time()> deadline);
  void resume(Thread& thread);
  void unwindKilled();
  void reap();

  std::mt19937_64 random_;
  Time now_{0};
  std::list<std::unique_ptr<Thread>> threads_;  // in the order of their birth
  Thread* running_ = nullptr;
  std::exception_ptr failure_;
};

}  // namespace kel::simulation
