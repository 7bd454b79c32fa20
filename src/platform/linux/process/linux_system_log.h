#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <string>
#include <string_view>

#include "platform/guarded.h"
#include "platform/linux/files/owned_descriptor.h"
#include "platform/system_log.h"

namespace kel::platform {

/// The text of a log line: control characters (line feeds and tabs too) and bytes that are no UTF-8 appear as
/// "#" and three octal digits, as log daemons write them; a text longer than the limit is cut between two
/// characters and ends in "[cut]".
std::string escapedForLog(std::string_view message);

/// The system log: datagrams to the log daemon's socket, facility user, severity notice, identifier "kel".
/// Without a daemon the lines go to standard error.
///
/// Any thread. Never waits: a message that the daemon, or standard error, does not take at once is dropped,
/// and the next one that gets through says how many were.
class LinuxSystemLog final : public SystemLog {
 public:
  explicit LinuxSystemLog(std::string socketPath = "/dev/log") : socketPath_(std::move(socketPath)) {}

  void write(std::string_view message) override;

 private:
  enum class Delivery { Delivered, NoDaemon, Refused };

  Delivery deliver(const std::string& datagram);
  std::shared_ptr<const OwnedDescriptor> connectToDaemon();

  const std::string socketPath_;
  Guarded<std::shared_ptr<const OwnedDescriptor>> socket_;  // null while there is no connection
  std::atomic<std::uint64_t> lost_ = 0;                     // messages dropped since the last one delivered
};

}  // namespace kel::platform
