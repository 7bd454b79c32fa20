#include "platform/linux/linux_system_log.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <optional>
#include <sys/socket.h>
#include <unistd.h>

#include "platform/linux/owned_descriptor.h"
#include "platform/linux/scratch.h"
#include "platform/linux/unix_address.h"
#include "platform/unicode.h"

namespace kel::platform {
namespace {

using testing::ContainsRegex;
using testing::EndsWith;
using testing::HasSubstr;
using testing::MatchesRegex;
using testing::Not;

/// A log daemon of the test's own.
class Daemon {
 public:
  explicit Daemon(std::string path) : path_(std::move(path)), socket_(socket(AF_UNIX, SOCK_DGRAM, 0)) {
    const auto address = unixAddress(path_);
    if (bind(socket_.get(), address->get(), address->length) != 0) throw std::runtime_error("bind");
  }
  ~Daemon() { unlink(path_.c_str()); }

  /// The next message, or absent when none is waiting.
  std::optional<std::string> receive() {
    char buffer[65536];
    const ssize_t length = recv(socket_.get(), buffer, sizeof buffer, MSG_DONTWAIT);
    return length < 0 ? std::nullopt : std::optional(std::string(buffer, static_cast<std::size_t>(length)));
  }

 private:
  std::string path_;
  OwnedDescriptor socket_;
};

class LinuxSystemLogTest : public testing::Test {
 protected:
  Scratch scratch;
  std::optional<Daemon> daemon{scratch / "log"};
  LinuxSystemLog log{scratch / "log"};
};

TEST_F(LinuxSystemLogTest, MessageIsANoticeOfThisProcess) {
  log.write("hello");
  EXPECT_THAT(
      daemon->receive().value_or("nothing"),
      MatchesRegex("<13>[A-Z][a-z][a-z] [ 0-9][0-9] [0-9][0-9]:[0-9][0-9]:[0-9][0-9] kel.[0-9]+.: hello"));
}

TEST_F(LinuxSystemLogTest, RestartedDaemonIsFoundAgain) {
  log.write("before");
  daemon.reset();
  daemon.emplace(scratch / "log");
  log.write("after");
  EXPECT_THAT(daemon->receive().value_or("nothing"), EndsWith(": after"));
}

TEST_F(LinuxSystemLogTest, MessagesThatTheDaemonDoesNotTakeAreCountedAndToldLater) {
  int sent = 0;
  constexpr int more = 10'000;  // far more than a socket holds
  for (; sent < more; ++sent) log.write("burst");
  int received = 0;
  while (daemon->receive()) ++received;
  ASSERT_LT(received, sent);
  log.write("next");
  EXPECT_THAT(daemon->receive().value_or("nothing"), EndsWith(": next [" + std::to_string(sent - received) +
                                                              " message(s) before this one were lost]"));
  log.write("last");
  EXPECT_THAT(daemon->receive().value_or("nothing"), EndsWith(": last")) << "told once";
}

TEST_F(LinuxSystemLogTest, WithoutADaemonLinesGoToStandardError) {
  daemon.reset();
  testing::internal::CaptureStderr();
  log.write("one\ntwo");
  EXPECT_EQ(testing::internal::GetCapturedStderr(), "kel[" + std::to_string(getpid()) + "]: one#012two\n");
}

TEST_F(LinuxSystemLogTest, StandardErrorThatTakesNothingLosesMessagesButHoldsNobodyUp) {
  daemon.reset();
  int ends[2];
  ASSERT_EQ(pipe(ends), 0);
  const OwnedDescriptor unread(ends[0]), kept(dup(STDERR_FILENO));
  dup2(ends[1], STDERR_FILENO);
  close(ends[1]);
  constexpr int written = 2000;
  for (int i = 0; i < written; ++i) log.write(std::string(3000, 'x'));  // ends at all: nothing waited
  dup2(kept.get(), STDERR_FILENO);
  daemon.emplace(scratch / "log");
  log.write("next");
  EXPECT_THAT(daemon->receive().value_or("nothing"),
              ContainsRegex("next .[0-9]+ message.s. before this one"));
}

TEST(EscapedForLog, ControlCharactersAndIllFormedBytesBecomeOctal) {
  const std::pair<std::string, std::string> rows[] = {
      {"a\nb\tc", "a#012b#011c"},
      {std::string("nul\0del\x7f", 8), "nul#000del#177"},
      {"caf\xc3\xa9 \xef\xbf\xbd", "caf\xc3\xa9 \xef\xbf\xbd"},
      {"c1\xc2\x9b", "c1#302#233"},
      {"bad\xff\xc3", "bad#377#303"},
  };
  for (const auto& [text, escaped] : rows) EXPECT_EQ(escapedForLog(text), escaped);
}

TEST(EscapedForLog, OverlongTextIsCutBetweenCharacters) {
  for (std::size_t shift = 0; shift < 4; ++shift) {
    std::string text(shift, 'a');
    for (int i = 0; i < 100'000; ++i) text += "\xf0\x9f\x98\x80";
    const std::string escaped = escapedForLog(text);
    EXPECT_TRUE(isValidUTF8(escaped)) << shift;
    EXPECT_THAT(escaped, EndsWith("[cut]"));
    EXPECT_LT(escaped.size(), 4000u);
    EXPECT_GT(escaped.size(), 3800u);
  }
  EXPECT_THAT(escapedForLog(std::string(3900, 'a')), Not(HasSubstr("[cut]")));
}

}  // namespace
}  // namespace kel::platform
