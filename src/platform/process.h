#pragma once

#include "platform/work_queue.h"

namespace kel::platform {

/// This process. Used from the main thread.
class Process {
 public:
  virtual ~Process() = default;

  /// The termination signal no longer ends the process by itself; `handler` runs, on a thread that serves no
  /// queue of the server, when it arrives.
  virtual void onTermination(Task handler) = 0;

  /// Ends the process at once; work under way is abandoned. Any thread.
  virtual void exitNow(int status) = 0;

  /// The main event loop; it never returns (a test's may).
  virtual void runMainLoop() = 0;
};

}  // namespace kel::platform
