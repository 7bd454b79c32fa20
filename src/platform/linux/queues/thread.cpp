#include "platform/linux/queues/thread.h"

#include <pthread.h>
#include <signal.h>

namespace kel::platform {

namespace {

/// Blocks signals on the calling thread while it lives; a thread started meanwhile inherits the mask.
class SignalsBlocked {
 public:
  SignalsBlocked() {
    sigset_t blocked;
    sigfillset(&blocked);
    for (const int fault : {SIGSEGV, SIGBUS, SIGFPE, SIGILL, SIGTRAP, SIGSYS, SIGABRT}) {
      sigdelset(&blocked, fault);
    }
    pthread_sigmask(SIG_SETMASK, &blocked, &previous_);
  }
  ~SignalsBlocked() { pthread_sigmask(SIG_SETMASK, &previous_, nullptr); }
  SignalsBlocked(const SignalsBlocked&) = delete;
  SignalsBlocked& operator=(const SignalsBlocked&) = delete;

 private:
  sigset_t previous_;
};

constexpr std::size_t longestThreadName = 15;

}  // namespace

std::thread startThread(const std::string& name, std::function<void()> body) {
  const SignalsBlocked blocked;
  return std::thread([name = name.substr(0, longestThreadName), body = std::move(body)] {
    pthread_setname_np(pthread_self(), name.c_str());
    body();
  });
}

}  // namespace kel::platform
