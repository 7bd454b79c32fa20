#pragma once

#include <condition_variable>
#include <mutex>
#include <utility>

namespace kel::platform {

/// A value that is reached only while its mutex is held, and whose changes can be waited for. Any thread.
/// What is given to it computes nothing long, calls nothing out and never waits.
template <typename T>
class Monitor {
 public:
  /// Whom a change is worth waking.
  enum class Wake { Nobody, One, All };

  /// Lets `work` change the value; it returns who of those that wait shall look again. They are woken when
  /// the lock is free, so whoever waits must not destroy the monitor for having seen the change.
  template <typename Work>
  void change(Work&& work) {
    const Wake wake = [&] {
      const std::lock_guard lock(mutex_);
      return std::forward<Work>(work)(value_);
    }();
    if (wake == Wake::One) changed_.notify_one();
    if (wake == Wake::All) changed_.notify_all();
  }

  /// Waits, without limit, until `isReady` holds for the value, and returns what `work` makes of it then.
  template <typename IsReady, typename Work>
  auto when(IsReady&& isReady, Work&& work) {
    std::unique_lock lock(mutex_);
    changed_.wait(lock, [&] { return isReady(std::as_const(value_)); });
    return std::forward<Work>(work)(value_);
  }

  /// The same for who only wants to know.
  template <typename IsReady>
  void await(IsReady&& isReady) {
    when(std::forward<IsReady>(isReady), [](const T&) {});
  }

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  T value_{};
};

}  // namespace kel::platform
