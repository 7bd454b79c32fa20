#include "platform/linux/linux_process.h"

#include <cerrno>
#include <csignal>
#include <pthread.h>
#include <semaphore.h>
#include <stdio.h>
#include <sys/resource.h>
#include <unistd.h>

#include "platform/linux/thread.h"

namespace kel::platform {

namespace {

// The one thing that a signal handler may do to wake a thread. Never destroyed: the signal may come late.
sem_t& terminationSignals() {
  static sem_t signals;
  return signals;
}

void terminationArrived(int) {
  const int kept = errno;
  sem_post(&terminationSignals());
  errno = kept;
}

void handleSignal(int number, void (*handler)(int)) {
  struct sigaction action {};
  action.sa_handler = handler;
  action.sa_flags = SA_RESTART;
  sigemptyset(&action.sa_mask);
  sigaction(number, &action, nullptr);
}

}  // namespace

LinuxProcess::LinuxProcess() {
  handleSignal(SIGPIPE, SIG_IGN);
  rlimit descriptors{};
  if (getrlimit(RLIMIT_NOFILE, &descriptors) != 0) return;
  descriptors.rlim_cur = descriptors.rlim_max;
  setrlimit(RLIMIT_NOFILE, &descriptors);
}

void LinuxProcess::onTermination(Task handler) {
  sem_init(&terminationSignals(), 0, 0);
  startThread("termination", [handler = std::move(handler)] {
    for (;;) {
      while (sem_wait(&terminationSignals()) != 0) {
      }
      handler();
    }
  }).detach();
  handleSignal(SIGTERM, terminationArrived);
  // A parent may have left the signal blocked; this thread is the one that takes it.
  sigset_t termination;
  sigemptyset(&termination);
  sigaddset(&termination, SIGTERM);
  pthread_sigmask(SIG_UNBLOCK, &termination, nullptr);
}

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

}  // namespace kel::platform
