#pragma once

#include <string>
#include <utility>
#include <vector>

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

/// One row of an option table: a long option without argument and the value it yields.
struct LongOption {
  std::string name;
  int value = 0;
};

/// What the parser met next.
struct ParsedOption {
  enum class Outcome { Option, Bad, End };
  Outcome outcome = Outcome::End;
  int value = 0;
};

/// The platform's long-option parser in its long-options-only mode: one dash or two, unambiguous prefixes
/// (with one dash at least two letters), arguments permuted. A bad option is reported on the error stream.
/// One parse at a time in a process.
class OptionParser {
 public:
  /// `arguments` begins with the program's name.
  OptionParser(std::vector<std::string> arguments, std::vector<LongOption> options);

  ParsedOption next();

  /// After `End`: the arguments that are no options, in their order.
  std::vector<std::string> remaining() const;

 private:
  std::vector<std::string> arguments_;
  std::vector<LongOption> options_;
  std::vector<char*> pointers_;
};

}  // namespace kel::platform
