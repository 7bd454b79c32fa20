#pragma once

#include <mutex>

#include "platform/annotations.h"

namespace kel::platform {

/// A mutex that clang's analysis follows: members marked `KEL_ON` it are proven to be touched under it only.
/// For what is held long, a scan or an exchange with a peer; short work is `Guarded`'s or `Monitor`'s.
class KEL_CAPABILITY("mutex") Mutex {
 public:
  Mutex() = default;
  Mutex(const Mutex&) = delete;
  Mutex& operator=(const Mutex&) = delete;

  void lock() KEL_ATTRIBUTE(acquire_capability()) { mutex_.lock(); }
  void unlock() KEL_ATTRIBUTE(release_capability()) { mutex_.unlock(); }

 private:
  std::mutex mutex_;
};

/// Holds a mutex as long as it lives.
class KEL_ATTRIBUTE(scoped_lockable) MutexLock {
 public:
  explicit MutexLock(Mutex& mutex) KEL_ATTRIBUTE(acquire_capability(mutex)) : mutex_(mutex) { mutex_.lock(); }
  MutexLock(const MutexLock&) = delete;
  MutexLock& operator=(const MutexLock&) = delete;
  ~MutexLock() KEL_ATTRIBUTE(release_capability()) { mutex_.unlock(); }

 private:
  Mutex& mutex_;
};

}  // namespace kel::platform
