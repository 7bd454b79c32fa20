#include "platform/linux/linux_transactions.h"

#include <cassert>
#include <string_view>

namespace kel::platform {

LinuxTransactions::LinuxTransactions(const std::optional<std::string>& notificationSocket)
    : address_(notificationSocket ? unixAddress(*notificationSocket) : std::nullopt) {
  if (address_) socket_ = OwnedDescriptor(socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
}

void LinuxTransactions::open() {
  if (count_.fetch_add(1) == 0) report();
}

void LinuxTransactions::close() {
  const std::uint64_t before = count_.fetch_sub(1);
  assert(before > 0);
  if (before == 1) report();
}

void LinuxTransactions::trackActivity() {
  tracking_ = true;
  report();
}

// Of several threads that have something to report one reports, the others only leave word: so reports arrive
// in order, the last one is true, and no thread waits for another.
void LinuxTransactions::report() {
  if (!tracking_ || !socket_ || reporters_.fetch_add(1) != 0) return;
  std::uint64_t seen = 0;
  do {
    seen = reporters_;
    const bool busy = count_ != 0;
    if ((!toldReady_ || busy != toldBusy_) && send(busy)) {
      toldReady_ = true;
      toldBusy_ = busy;
    }
  } while (reporters_.fetch_sub(seen) != seen);
}

bool LinuxTransactions::send(bool busy) {
  const std::string_view status = busy ? "STATUS=busy" : "STATUS=idle";
  const std::string message = std::string(toldReady_ ? "" : "READY=1\n").append(status);
  return sendto(socket_.get(), message.data(), message.size(), MSG_NOSIGNAL | MSG_DONTWAIT, address_->get(),
                address_->length) >= 0;
}

}  // namespace kel::platform
