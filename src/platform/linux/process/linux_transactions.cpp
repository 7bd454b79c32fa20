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
  work_.change([](Work& work) {
    work.ending = true;
    return Wake::One;
  });
  if (reporter_.joinable()) reporter_.join();
}

void LinuxTransactions::open() {
  work_.change([](Work& work) {
    ++work.open;
    return Wake::One;
  });
}

void LinuxTransactions::close() {
  work_.change([](Work& work) {
    assert(work.open > 0);
    --work.open;
    return Wake::One;
  });
}

void LinuxTransactions::trackActivity() {
  if (socket_) reporter_ = startThread("launcher", [this] { reportChanges(); });
}

void LinuxTransactions::reportChanges() {
  bool toldReady = false;
  std::optional<std::uint64_t> told;
  while (const std::optional<std::uint64_t> count = awaitNews(told)) {
    const Report result = report(!toldReady, *count);
    if (result == Report::Taken) toldReady = true;
    if (result != Report::KeptBack) told = count;
    // What changes meanwhile is one report, and wakes nobody.
    std::this_thread::sleep_for(reportInterval);
  }
}

/// The count, once it is another than was told; absent at the end.
std::optional<std::uint64_t> LinuxTransactions::awaitNews(std::optional<std::uint64_t> told) {
  return work_.when([told](const Work& work) { return work.ending || told != work.open; },
                    [](const Work& work) { return work.ending ? std::nullopt : std::optional(work.open); });
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
