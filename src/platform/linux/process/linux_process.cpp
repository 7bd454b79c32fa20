#include "platform/linux/process/linux_process.h"

#include <cerrno>
#include <csignal>
#include <poll.h>
#include <pthread.h>
#include <stdio.h>
#include <sys/resource.h>
#include <sys/signalfd.h>
#include <system_error>
#include <unistd.h>

#include "platform/linux/queues/thread.h"

namespace kel::platform {

namespace {

sigset_t terminationSignal() {
  sigset_t signals;
  sigemptyset(&signals);
  sigaddset(&signals, SIGTERM);
  return signals;
}

}  // namespace

LinuxProcess::LinuxProcess() {
  std::signal(SIGPIPE, SIG_IGN);
  rlimit descriptors{};
  if (getrlimit(RLIMIT_NOFILE, &descriptors) != 0) return;
  descriptors.rlim_cur = descriptors.rlim_max;
  setrlimit(RLIMIT_NOFILE, &descriptors);
}

void LinuxProcess::onTermination(Task handler) {
  // Blocked on the main thread; the others are started with every signal blocked. So it stays pending for us.
  const sigset_t termination = terminationSignal();
  pthread_sigmask(SIG_BLOCK, &termination, nullptr);
  const int arrivals = signalfd(-1, &termination, SFD_CLOEXEC);
  if (arrivals < 0) throw std::system_error(errno, std::generic_category(), "signalfd");
  startThread("termination", [handler = std::move(handler), termination, arrivals] {
    for (;;) {
      // Waited for, but left pending while the handler runs: that is how other threads see that it came.
      pollfd arrival{arrivals, POLLIN, 0};
      if (poll(&arrival, 1, -1) != 1) continue;
      handler();
      int number = 0;
      sigwait(&termination, &number);
    }
  }).detach();
}

// Static objects are not destroyed: other threads go on using them to the end.
void LinuxProcess::exitNow(int status) {
  if (ftrylockfile(stdout) == 0) {
    fflush_unlocked(stdout);
    funlockfile(stdout);
  }
  _exit(status);
}

void LinuxProcess::runMainLoop() {
  for (;;) pause();
}

bool isTerminating() {
  sigset_t pending;
  sigemptyset(&pending);
  return sigpending(&pending) == 0 && sigismember(&pending, SIGTERM) == 1;
}

}  // namespace kel::platform
