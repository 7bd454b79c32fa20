#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <thread>

#include "platform/linux/files/owned_descriptor.h"
#include "platform/linux/process/unix_address.h"
#include "platform/linux/queues/monitor.h"
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
  /// it is another than the launcher heard last, a few dozen times a second at most. While the launcher's
  /// queue is full a report is tried again with the count of then, so that the last one it gets is true.
  /// While nobody listens reports are lost; the next one that is heard says that the process is ready, too.
  /// Once.
  void trackActivity();

 private:
  enum class Report { Taken, KeptBack, Unheard };

  struct Work {
    std::uint64_t open = 0;
    bool ending = false;  // nobody is to be told any more
  };
  using Wake = Monitor<Work>::Wake;

  void reportChanges();
  std::optional<std::uint64_t> awaitNews(std::optional<std::uint64_t> told);
  Report report(bool withReadiness, std::uint64_t count) const;

  // Fixed after construction.
  std::optional<UnixAddress> address_;
  OwnedDescriptor socket_;

  Monitor<Work> work_;    // only the reporter waits for its changes
  std::thread reporter_;  // none before `trackActivity`
};

}  // namespace kel::platform
