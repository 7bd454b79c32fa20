#pragma once

#include <iosfwd>
#include <string>
#include <vector>

#include "protocol/request_protocol.h"

namespace kel {

/// The command-line client: parses `arguments` (the program's name first), runs the actions they ask for in
/// their fixed order, prints to `output`, and returns the exit status of the process.
int parse_arguments(const std::vector<std::string>& arguments, platform::Platform& platform,
                    std::ostream& output);

/// What of a reply is printed; debug output always is.
enum class PrintedData { Yes, No };

/// Prints a reply, or the error object that came in its place.
void print_reply(const platform::ConduitReply& reply, PrintedData printedData, std::ostream& output);

}  // namespace kel
