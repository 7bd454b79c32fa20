#pragma once

#include <memory>
#include <string>
#include <vector>

namespace kel::platform {

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
/// One parse at a time in a process. Like the work queues it is used where it is needed and not handed down:
/// the platform that is linked in defines its body.
class OptionParser {
 public:
  /// `arguments` begins with the program's name.
  OptionParser(std::vector<std::string> arguments, std::vector<LongOption> options);

  ~OptionParser();

  ParsedOption next();

  /// After `End`: the arguments that are no options, in their order.
  std::vector<std::string> remaining() const;

 private:
  struct Body;
  const std::unique_ptr<Body> body_;
};

}  // namespace kel::platform
