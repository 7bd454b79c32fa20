#pragma once

#include <functional>
#include <string>
#include <thread>

namespace kel::platform {

/// Starts a thread named `name` (cut to the 15 bytes that the kernel keeps) on which every signal but the
/// synchronous faults is blocked, so that signals reach the thread that waits for them. Throws
/// std::system_error when the system has no thread left.
std::thread startThread(const std::string& name, std::function<void()> body);

}  // namespace kel::platform
