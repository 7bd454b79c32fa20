#pragma once

#include <atomic>
#include <cstdint>
#include <optional>
#include <string>

#include "platform/linux/owned_descriptor.h"
#include "platform/linux/unix_address.h"
#include "platform/transactions.h"

namespace kel::platform {

/// The process-wide count of open work, told to the launcher through its notification socket. Any thread.
class LinuxTransactions final : public Transactions {
 public:
  /// `notificationSocket` is the launcher's (NOTIFY_SOCKET): a path, or "@" and an abstract name. Absent or
  /// unusable: nothing is reported.
  explicit LinuxTransactions(const std::optional<std::string>& notificationSocket);

  void open() override;
  void close() override;

  /// Reports from here on: at once that the process is ready, then every change between idle and busy. Never
  /// waits; a report that the launcher does not take is made up for by the next one.
  void trackActivity();

  std::uint64_t openCount() const { return count_; }

 private:
  void report();
  bool send(bool busy);

  std::optional<UnixAddress> address_;
  OwnedDescriptor socket_;
  std::atomic<std::uint64_t> count_ = 0;
  std::atomic<bool> tracking_ = false;
  std::atomic<std::uint64_t> reporters_ = 0;  // calls of `report` that the one at work has not looked after

  // Only in the one `report` at work.
  bool toldReady_ = false;
  bool toldBusy_ = false;
};

}  // namespace kel::platform
