#pragma once

#include "platform/process.h"

namespace kel::platform {

/// This process. One object at a time; used from the main thread but for `exitNow`.
///
/// Making it lets writes to closed pipes and sockets fail instead of ending the process, and lets the process
/// have as many descriptors as it is entitled to: the usual limit is kept low for the sake of programs that
/// wait with `select`, which this one never does. The termination signal keeps its default effect until
/// `onTermination`, so that a client can be ended like any program.
class LinuxProcess final : public Process {
 public:
  LinuxProcess();
  LinuxProcess(const LinuxProcess&) = delete;
  LinuxProcess& operator=(const LinuxProcess&) = delete;

  /// `handler` runs on a thread of its own that lives as long as the process. Once. Throws std::system_error
  /// when the process has no descriptor left.
  void onTermination(Task handler) override;

  /// What was printed reaches standard output, unless a thread is just printing; nothing else is cleaned up,
  /// and no lock of another thread is waited for.
  [[noreturn]] void exitNow(int status) override;

  [[noreturn]] void runMainLoop() override;
};

/// Whether the termination signal has been sent, even if its handler has not had its turn yet. After
/// `onTermination`, on any thread.
bool isTerminating();

}  // namespace kel::platform
