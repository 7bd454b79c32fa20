#include "platform/linux/linux_transactions.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <thread>
#include <unistd.h>
#include <vector>

#include "platform/linux/owned_descriptor.h"
#include "platform/linux/scratch.h"

namespace kel::platform {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;

/// A launcher's notification socket.
class Launcher {
 public:
  explicit Launcher(const std::string& name) : socket_(socket(AF_UNIX, SOCK_DGRAM, 0)) {
    const auto address = unixAddress(name);
    if (bind(socket_.get(), address->get(), address->length) != 0) throw std::runtime_error("bind");
  }

  std::vector<std::string> received() {
    std::vector<std::string> messages;
    char buffer[4096];
    for (ssize_t length = 0; (length = recv(socket_.get(), buffer, sizeof buffer, MSG_DONTWAIT)) >= 0;) {
      messages.emplace_back(buffer, static_cast<std::size_t>(length));
    }
    return messages;
  }

 private:
  OwnedDescriptor socket_;
};

TEST(LinuxTransactions, LauncherHearsOfReadinessAndThenOnlyOfChangesBetweenIdleAndBusy) {
  Scratch scratch;
  for (const std::string& name : {scratch / "notify", "@kel-test-" + std::to_string(getpid())}) {
    Launcher launcher(name);
    LinuxTransactions transactions(name);
    { const Transaction untold(transactions); }
    EXPECT_THAT(launcher.received(), IsEmpty()) << "activity is not tracked yet";
    transactions.trackActivity();
    EXPECT_THAT(launcher.received(), ElementsAre("READY=1\nSTATUS=idle"));
    {
      const Transaction first(transactions);
      const Transaction second(first);
      EXPECT_THAT(launcher.received(), ElementsAre("STATUS=busy"));
    }
    EXPECT_THAT(launcher.received(), ElementsAre("STATUS=idle"));
    EXPECT_EQ(transactions.openCount(), 0u);
  }
}

TEST(LinuxTransactions, ReportThatWasNotTakenIsMadeUpFor) {
  Scratch scratch;
  LinuxTransactions transactions(scratch / "notify");
  transactions.trackActivity();
  Launcher launcher(scratch / "notify");
  const Transaction open(transactions);
  EXPECT_THAT(launcher.received(), ElementsAre("READY=1\nSTATUS=busy"));
  LinuxTransactions unusable(std::string("relative"));
  unusable.trackActivity();
  unusable.open();
  unusable.close();
}

TEST(LinuxTransactions, LastReportIsTrueWhateverThreadsRaced) {
  Scratch scratch;
  Launcher launcher(scratch / "notify");
  LinuxTransactions transactions(scratch / "notify");
  transactions.trackActivity();
  std::string last;
  std::atomic<int> running = 4;
  std::vector<std::thread> threads;
  for (int i = 0; i < 4; ++i) {
    threads.emplace_back([&] {
      for (int j = 0; j < 2000; ++j) const Transaction transaction(transactions);
      --running;
    });
  }
  const auto read = [&] {
    for (const std::string& message : launcher.received()) last = message;
  };
  while (running > 0) read();
  for (std::thread& thread : threads) thread.join();
  read();
  // A report that met a full socket is made up for by this.
  { const Transaction flush(transactions); }
  read();
  EXPECT_EQ(last, "STATUS=idle");
}

}  // namespace
}  // namespace kel::platform
