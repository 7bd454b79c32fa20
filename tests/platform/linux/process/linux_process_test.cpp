#include "platform/linux/process/linux_process.h"

#include <cerrno>
#include <sys/resource.h>

#include "platform/linux/process/linux_system_facts.h"
#include "platform/linux/process/linux_system_log.h"
#include "platform/linux/process/linux_transactions.h"
#include "platform/linux/process/process_confinement.h"
#include "platform/linux/scratch.h"
#include "platform/option_parser.h"
#include "property_lists/unicode.h"

namespace kel::platform {
namespace {

using namespace testing;

TEST(LinuxProcess, MayHaveEveryDescriptorItIsEntitledTo) {
  rlimit limit{};
  getrlimit(RLIMIT_NOFILE, &limit);
  limit.rlim_cur = 64;
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &limit), 0);
  const LinuxProcess process;
  getrlimit(RLIMIT_NOFILE, &limit);
  EXPECT_EQ(limit.rlim_cur, limit.rlim_max);
}

TEST(ProcessConfinement, ScopesOfSandboxedRuntimesAndConfiningLabelsAreToldAndDoubtsCount) {
  EXPECT_TRUE(isSandboxed(getpid(), -1));
  EXPECT_TRUE(namesSandboxScope("0::/user.slice/app.slice/app-flatpak-org.example.App-12.scope\n"));
  EXPECT_TRUE(namesSandboxScope("1:name=systemd:/a/snap.editor.editor-1.scope/inner\n0::/\n"));
  EXPECT_FALSE(namesSandboxScope("8:pids:/\n0::/app.slice/flatpak-portal.service\n"));
  EXPECT_FALSE(namesSandboxScope("0::/app.slice/app-flatpak-org.example.App.scope-1/snap.editor\n"));
  EXPECT_TRUE(isConfiningLabel("snap.editor.editor (enforce)", "unconfined"));
  EXPECT_TRUE(isConfiningLabel("system_u:system_r:container_t:s0:c1,c2", ""));
  for (const char* label :
       {"", "browser (unconfined)", "unconfined_u:unconfined_r:unconfined_t:s0", "container (enforce)"})
    EXPECT_FALSE(isConfiningLabel(label, "container (enforce)")) << label;
}

using LinuxSystemFactsTest = ScratchTest;

TEST_F(LinuxSystemFactsTest, TheVersionIsMadeOfWhatTheReleaseFileAssigns) {
  const std::pair<std::string, std::string> rows[] = {
      {"ID=debian\nVERSION_ID=\"12\"", "debian 12"},
      {"# ID=x\n\n NAME\n\tID='a\\b' \r\nVERSION_ID=\"1\\\"2\\\\\"\n", "a\\b 1\"2\\"},
      {"VERSION_ID=\"\nID=''\n", "\""},
      {"ID=a\nID=b\nIMAGE_VERSION=3\nBUILD_ID=7", "b 7"},
      {"ID=b\nIMAGE_VERSION=3", "b 3"},
      {"ID=\xff\nVERSION_ID=2", "2"},
      {"ID=", "<unknown version>"},
  };
  const auto version = [this] { return LinuxSystemFacts(scratch.path()).buildVersion(); };
  EXPECT_THAT(version(), StartsWith("<unknown version> (kel "));
  scratch.write("usr/lib/os-release", "ID=vendor");
  EXPECT_THAT(version(), StartsWith("vendor (kel "));
  for (const auto& [text, expected] : rows) {
    scratch.write("etc/os-release", text);
    EXPECT_THAT(version(), StartsWith(expected + " (kel ")) << text;
  }
}

TEST_F(LinuxSystemFactsTest, NumbersAreReadWholeOrNotAtAll) {
  LinuxSystemFacts facts(scratch.path());
  EXPECT_EQ(facts.auditSession().errorNumber, ENOENT);
  for (const char* text : {"", "12x", "-1", "4294967296"}) {
    scratch.write("proc/self/sessionid", text);
    EXPECT_EQ(facts.auditSession().errorNumber, EINVAL) << text;
  }
  scratch.write("proc/self/sessionid", "4294967295\n");
  EXPECT_EQ(facts.auditSession().value, -1);
  scratch.write("proc/sys/kernel/random/boot_id", "\n");
  EXPECT_EQ(facts.bootTime().errorNumber, ENODATA);
  scratch.write("proc/sys/kernel/random/boot_id", "1b4e28ba\n");
  const auto boot = facts.bootTime().value;
  scratch.write("proc/sys/kernel/random/boot_id", "1b4e28bb\n");
  EXPECT_NE(facts.bootTime().value, boot);
}

TEST(OptionParser, BadOptionsAreReportedOnTheErrorStream) {
  for (const auto& [argument, message] : std::vector<std::pair<std::string, std::string>>{
           {"-f", "unrecognized option '-f'"},
           {"-dum", "option '-dum' is ambiguous; possibilities: '-dump' '-dump_cache'"},
           {"-flush=now", "option '-flush' doesn't allow an argument"}}) {
    testing::internal::CaptureStderr();
    OptionParser parser({"kel", "en", argument}, {{"dump", 2}, {"dump_cache", 3}, {"flush", 5}});
    EXPECT_EQ(parser.next().outcome, ParsedOption::Outcome::Bad);
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "kel: " + message + "\n");
  }
}

OwnedDescriptor daemonAt(const std::string& name) {
  OwnedDescriptor daemon(socket(AF_UNIX, SOCK_DGRAM, 0));
  const auto address = unixAddress(name);
  EXPECT_EQ(bind(daemon.get(), address->get(), address->length), 0);
  return daemon;
}

/// What has arrived since the last call.
std::vector<std::string> received(const OwnedDescriptor& daemon) {
  std::vector<std::string> messages;
  char buffer[65536];
  for (ssize_t length = 0; (length = recv(daemon.get(), buffer, sizeof buffer, MSG_DONTWAIT)) >= 0;)
    messages.emplace_back(buffer, static_cast<std::size_t>(length));
  return messages;
}

struct LinuxSystemLogTest : testing::Test {
  Scratch scratch;
  OwnedDescriptor daemon = daemonAt(scratch / "log");
  LinuxSystemLog log{scratch / "log"};
};

TEST_F(LinuxSystemLogTest, MessageIsANoticeOfThisProcessAndARestartedDaemonIsFoundAgain) {
  for (int i = 0; i < 2; ++i) {
    log.write("hello");
    EXPECT_THAT(received(daemon),
                ElementsAre(MatchesRegex("<13>[A-Z][a-z][a-z] [ 0-9][0-9] [0-9:]* kel.[0-9]+.: hello")));
    unlink((scratch / "log").c_str());
    daemon = daemonAt(scratch / "log");
  }
}

TEST_F(LinuxSystemLogTest, MessagesThatTheDaemonDoesNotTakeAreCountedAndToldLaterOnce) {
  constexpr std::size_t sent = 10'000;  // far more than a socket holds
  for (std::size_t i = 0; i < sent; ++i) log.write("burst");
  const std::size_t lost = sent - received(daemon).size();
  ASSERT_GT(lost, 0u);
  log.write("next");
  log.write("last");
  EXPECT_THAT(received(daemon), ElementsAre(EndsWith(": next [" + std::to_string(lost) +
                                                     " message(s) before this one were lost]"),
                                            EndsWith(": last")));
}

TEST(EscapedForLog, ControlCharactersAndIllFormedBytesBecomeOctalAndOverlongTextIsCut) {
  for (const auto& [text, escaped] : std::vector<std::pair<std::string, std::string>>{
           {std::string("a\nb\0del\x7f", 8), "a#012b#000del#177"},
           {"caf\xc3\xa9 \xef\xbf\xbd", "caf\xc3\xa9 \xef\xbf\xbd"},
           {"c1\xc2\x9b bad\xff\xc3", "c1#302#233 bad#377#303"},
           {std::string(3900, 'a'), std::string(3900, 'a')}})
    EXPECT_EQ(escapedForLog(text), escaped);
  for (std::size_t shift = 0; shift < 4; ++shift) {
    std::string text(shift, 'a');
    for (int i = 0; i < 100'000; ++i) text += "\xf0\x9f\x98\x80";
    const std::string escaped = escapedForLog(text);
    EXPECT_TRUE(isValidUTF8(escaped) && escaped.ends_with("[cut]")) << shift;
    EXPECT_NEAR(static_cast<double>(escaped.size()), 3900, 10);
  }
}

/// Reads reports up to `last`; returns the first.
std::string awaitReport(const OwnedDescriptor& launcher, const std::string& last) {
  const timeval deadline{30, 0};
  setsockopt(launcher.get(), SOL_SOCKET, SO_RCVTIMEO, &deadline, sizeof deadline);
  std::string first, report;
  while (!report.ends_with(last)) {
    char buffer[256];
    const ssize_t length = recv(launcher.get(), buffer, sizeof buffer, 0);
    if (length < 0) return "in vain";
    report.assign(buffer, static_cast<std::size_t>(length));
    if (first.empty()) first = report;
  }
  return first;
}

TEST(LinuxTransactions, LauncherHearsOfReadinessFirstAndOfTheTrueCountLast) {
  Scratch scratch;
  for (const std::string& name : {scratch / "notify", "@kel-test-" + std::to_string(getpid())}) {
    LinuxTransactions transactions(name);
    transactions.trackActivity();  // a report that nobody listens for is made up for
    const OwnedDescriptor launcher = daemonAt(name), other(socket(AF_UNIX, SOCK_DGRAM, 0));
    {
      const Transaction first(transactions);
      const Transaction second(first);
      EXPECT_THAT(awaitReport(launcher, "STATUS=2 open transactions"), StartsWith("READY=1\nSTATUS="));
      const auto address = unixAddress(name);
      while (sendto(other.get(), "", 1, MSG_DONTWAIT, address->get(), address->length) == 1) {
      }
      for (int i = 0; i < 10'000; ++i) const Transaction brief(transactions);
    }
    EXPECT_NE(awaitReport(launcher, "STATUS=0 open transactions"), "in vain") << "the queue was full before";
  }
}

}  // namespace
}  // namespace kel::platform
