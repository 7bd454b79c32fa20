#pragma once

#include <mutex>
#include <utility>

namespace kel::platform {

/// A value that is reached only while its mutex is held. The work given to `with` computes nothing long,
/// calls nothing out and never waits.
template <typename T>
class Guarded {
 public:
  Guarded() = default;
  explicit Guarded(T value) : value_(std::move(value)) {}

  template <typename Work>
  decltype(auto) with(Work&& work) {
    const std::lock_guard lock(mutex_);
    return std::forward<Work>(work)(value_);
  }

  T copy() const {
    const std::lock_guard lock(mutex_);
    return value_;
  }

  void set(T value) {
    const std::lock_guard lock(mutex_);
    std::swap(value_, value);
  }

 private:
  mutable std::mutex mutex_;
  T value_{};
};

/// A value computed at its first use and kept; first calls from several threads compute it once.
template <typename T>
class Once {
 public:
  template <typename Compute>
  const T& get(Compute&& compute) {
    std::call_once(flag_, [&] { value_ = std::forward<Compute>(compute)(); });
    return value_;
  }

 private:
  std::once_flag flag_;
  T value_{};
};

}  // namespace kel::platform
