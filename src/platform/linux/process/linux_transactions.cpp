#include "platform/linux/process/linux_transactions.h"

#include <cassert>
#include <cerrno>
#include <chrono>
#include <sys/socket.h>

#include "platform/linux/queues/thread.h"

namespace kel::platform {

namespace {

using namespace std::chrono_literals;

constexpr auto reportInterval = 20ms;

}  // namespace

LinuxTransactions::LinuxTransactions(const std::optional<std::string>& notificationSocket)
    : address_(notificationSocket ? unixAddress(*notificationSocket) : std::nullopt) {
  if (address_) socket_ = OwnedDescriptor(socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
}

LinuxTransactions::~LinuxTransactions() {
  {
    const std::lock_guard lock(mutex_);
    ending_ = true;
  }
  changed_.notify_one();
  if (reporter_.joinable()) reporter_.join();
}

void LinuxTransactions::open() {
  {
    const std::lock_guard lock(mutex_);
    ++count_;
  }
  changed_.notify_one();
}

void LinuxTransactions::close() {
  {
    const std::lock_guard lock(mutex_);
    assert(count_ > 0);
    --count_;
  }
  changed_.notify_one();
}

void LinuxTransactions::trackActivity() {
  if (socket_) reporter_ = startThread("launcher", [this] { reportChanges(); });
}

void LinuxTransactions::reportChanges() {
  bool toldReady = false;
  std::optional<std::uint64_t> told;
  std::unique_lock lock(mutex_);
  while (!ending_) {
    const std::uint64_t count = count_;
    lock.unlock();
    const Report result = report(!toldReady, count);
    if (result == Report::Taken) toldReady = true;
    if (result != Report::KeptBack) told = count;
    // What changes meanwhile is one report, and wakes nobody.
    std::this_thread::sleep_for(reportInterval);
    lock.lock();
    changed_.wait(lock, [&] { return ending_ || told != count_; });
  }
}

LinuxTransactions::Report LinuxTransactions::report(bool withReadiness, std::uint64_t count) const {
  const std::string message = std::string(withReadiness ? "READY=1\n" : "")
                                  .append("STATUS=")
                                  .append(std::to_string(count))
                                  .append(" open transactions");
  if (sendto(socket_.get(), message.data(), message.size(), MSG_NOSIGNAL | MSG_DONTWAIT, address_->get(),
             address_->length) >= 0) {
    return Report::Taken;
  }
  return errno == EAGAIN || errno == ENOBUFS || errno == EINTR ? Report::KeptBack : Report::Unheard;
}

}  // namespace kel::platform
