#pragma once

#include <condition_variable>
#include <cstdint>
#include <mutex>
#include <optional>
#include <string>
#include <thread>

#include "platform/linux/files/owned_descriptor.h"
#include "platform/linux/process/unix_address.h"
#include "platform/transactions.h"

namespace kel::platform {

/// The process-wide count of open work, told to the launcher through its notification socket. Any thread.
class LinuxTransactions final : public Transactions {
 public:
  /// `notificationSocket` is the launcher's (NOTIFY_SOCKET): a path, or "@" and an abstract name. Absent or
  /// unusable: nothing is reported.
  explicit LinuxTransactions(const std::optional<std::string>& notificationSocket);
  LinuxTransactions(const LinuxTransactions&) = delete;
  LinuxTransactions& operator=(const LinuxTransactions&) = delete;
  ~LinuxTransactions() override;

  void open() override;
  void close() override;

  /// Reports from here on, on a thread of its own: at once that the process is ready, and the count whenever
  /// it is another than the launcher heard last, a few dozen times a second at most. While the launcher takes
  /// no more a report is kept back, so that the last one is true; one that nobody listens for is made up for
  /// by the next. Once.
  void trackActivity();

 private:
  enum class Report { Taken, KeptBack, Unheard };

  void reportChanges();
  Report report(bool withReadiness, std::uint64_t count) const;

  // Fixed after construction.
  std::optional<UnixAddress> address_;
  OwnedDescriptor socket_;

  std::mutex mutex_;
  std::condition_variable changed_;
  std::uint64_t count_ = 0;  // under mutex_
  bool ending_ = false;      // under mutex_
  std::thread reporter_;
};

}  // namespace kel::platform
