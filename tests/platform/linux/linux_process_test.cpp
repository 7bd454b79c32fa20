#include "platform/linux/linux_process.h"

#include <functional>
#include <optional>
#include <sched.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <thread>

#include "platform/linux/linux_peer_process.h"
#include "platform/linux/linux_sandbox_query.h"
#include "platform/linux/linux_system_log.h"
#include "platform/linux/linux_transactions.h"
#include "platform/linux/process_confinement.h"
#include "platform/unicode.h"
#include "scratch.h"

namespace kel::platform {
namespace {

using testing::ContainsRegex;
using testing::ElementsAre;
using testing::EndsWith;
using testing::MatchesRegex;

TEST(LinuxProcess, MayHaveEveryDescriptorItIsEntitledTo) {
  rlimit before{}, after{};
  getrlimit(RLIMIT_NOFILE, &before);
  const rlimit usual{64, before.rlim_max};
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &usual), 0);
  const LinuxProcess process;
  getrlimit(RLIMIT_NOFILE, &after);
  EXPECT_EQ(after.rlim_cur, before.rlim_max);
  setrlimit(RLIMIT_NOFILE, &before);
}

/// What the sandbox query says of a child that prepared itself and, when `ended`, has gone since; -1 when it
/// could not prepare itself.
int check(const std::function<bool()>& prepare, bool ended = false) {
  int ends[2];
  if (pipe(ends) != 0) return -1;
  const OwnedDescriptor ready(ends[0]), told(ends[1]);
  const pid_t child = fork();
  if (child == 0) {
    const char answer = prepare() ? 'y' : 'n';
    if (write(told.get(), &answer, 1) == 1) pause();
    _exit(0);
  }
  const LinuxPeerProcess peer(child, OwnedDescriptor(static_cast<int>(syscall(SYS_pidfd_open, child, 0))));
  char answer = 'n';
  if (read(ready.get(), &answer, 1) != 1) return -1;
  siginfo_t info{};
  if (ended) kill(child, SIGKILL);
  if (ended) waitid(P_PID, static_cast<id_t>(child), &info, WEXITED | WNOWAIT);  // its id stays taken
  const int result = answer == 'y' ? LinuxSandboxQuery().check(peer) : -1;
  kill(child, SIGKILL);
  waitpid(child, nullptr, 0);
  return result;
}

TEST(LinuxSandboxQuery, ProcessesWithOtherNamespacesOrRootsAndThoseThatHaveGoneAreSandboxed) {
  const auto nothing = [] { return true; };
  const Scratch scratch;
  EXPECT_EQ(check(nothing), 0);
  EXPECT_EQ(check(nothing, true), 1);
  const int otherUserNamespace = check([] { return unshare(CLONE_NEWUSER) == 0; });
  const int otherRoot = check([&] { return chroot(scratch.path().c_str()) == 0; });
  EXPECT_NE(otherUserNamespace, 0);
  EXPECT_NE(otherRoot, 0);
  const OwnedDescriptor self(static_cast<int>(syscall(SYS_pidfd_open, getpid(), 0)));
  EXPECT_FALSE(isSandboxed(getpid(), self.get()));
  EXPECT_TRUE(isSandboxed(getpid(), -1));
  if (otherUserNamespace < 0 || otherRoot < 0) GTEST_SKIP() << "the kernel refuses namespaces or roots";
}

TEST(ProcessConfinement, ScopesOfSandboxedRuntimesAndConfiningLabelsAreTold) {
  const std::pair<const char*, bool> scopes[] = {
      {"0::/user.slice/app.slice/app-flatpak-org.example.App-12.scope\n", true},
      {"1:name=systemd:/a/snap.editor.editor-1.scope/inner\n0::/\n", true},
      {"0::/system.slice/snap.daemon.service\n", true},
      {"0::/user.slice/app.slice/flatpak-portal.service\n", false},
      {"8:pids:/\n0::/user.slice/app-org.example.flatpak-helper.scope\n", false},
  };
  for (const auto& [text, sandboxed] : scopes) EXPECT_EQ(namesSandboxScope(text), sandboxed) << text;
  const struct {
    const char *label, *own;
    bool confines;
  } labels[] = {
      {"", "", false},
      {"browser (unconfined)", "unconfined", false},
      {"snap.editor.editor (enforce)", "unconfined", true},
      {"container (enforce)", "container (enforce)", false},
      {"unconfined_u:unconfined_r:unconfined_t:s0-s0:c0.c1023", "", false},
      {"system_u:system_r:container_t:s0:c1,c2", "unconfined_u:unconfined_r:unconfined_t:s0", true},
  };
  for (const auto& row : labels) EXPECT_EQ(isConfiningLabel(row.label, row.own), row.confines) << row.label;
}

TEST(OptionParser, OptionsAreRecognisedAndBadOnesReportedAsTheTableOfCasesSays) {
  const std::vector<LongOption> table{{"help", 1},   {"dump", 2},  {"dump_pboard", 2}, {"dump_cache", 3},
                                      {"update", 4}, {"flush", 5}, {"debug", 6},       {"mockar", 7}};
  const auto bad = [](const char* option) {
    return "kel: unrecognized option '" + std::string(option) + "'\n";
  };
  const struct {
    std::vector<std::string> arguments;
    std::string story, reported = "";
  } rows[] = {
      {{}, "|"},
      {{"-dump_p", "--f", "-he", "-de"}, "2 5 1 6 |"},
      {{"en", "-dump", "fr", "-f", "de"}, "2 bad | en fr de", bad("-f")},
      {{"-d", "-bogus", "-flush"}, "bad bad 5 |", bad("-d") + bad("-bogus")},
      {{"-dum"},
       "bad |",
       "kel: option '-dum' is ambiguous; possibilities: '-dump' '-dump_pboard' '-dump_cache'\n"},
      {{"-flush=now"}, "bad |", "kel: option '-flush' doesn't allow an argument\n"},
      {{"-", "", "-update", "--", "-fr", "-f"}, "4 | -  -fr -f"},
  };
  for (const auto& row : rows) {
    std::vector<std::string> arguments = row.arguments;
    arguments.insert(arguments.begin(), "kel");
    OptionParser parser(arguments, table);
    testing::internal::CaptureStderr();
    std::string story;
    using Outcome = ParsedOption::Outcome;
    for (ParsedOption each = parser.next(); each.outcome != Outcome::End; each = parser.next()) {
      story += each.outcome == Outcome::Bad ? "bad " : std::to_string(each.value) + " ";
    }
    story += "|";
    for (const std::string& argument : parser.remaining()) story += " " + argument;
    EXPECT_EQ(story, row.story);
    EXPECT_EQ(testing::internal::GetCapturedStderr(), row.reported);
  }
}

/// A daemon's datagram socket.
class Daemon {
 public:
  explicit Daemon(const std::string& name) : socket_(socket(AF_UNIX, SOCK_DGRAM, 0)) {
    const auto address = unixAddress(name);
    if (bind(socket_.get(), address->get(), address->length) != 0) throw std::runtime_error("bind");
  }

  /// What has arrived since the last call.
  std::vector<std::string> received() {
    std::vector<std::string> messages;
    char buffer[65536];
    for (ssize_t length = 0; (length = recv(socket_.get(), buffer, sizeof buffer, MSG_DONTWAIT)) >= 0;) {
      messages.emplace_back(buffer, static_cast<std::size_t>(length));
    }
    return messages;
  }

 private:
  OwnedDescriptor socket_;
};

class LinuxSystemLogTest : public testing::Test {
 protected:
  Scratch scratch;
  std::optional<Daemon> daemon{scratch / "log"};
  LinuxSystemLog log{scratch / "log"};
};

TEST_F(LinuxSystemLogTest, MessageIsANoticeOfThisProcessAndARestartedDaemonIsFoundAgain) {
  for (int i = 0; i < 2; ++i) {
    log.write("hello");
    EXPECT_THAT(daemon->received(),
                ElementsAre(MatchesRegex("<13>[A-Z][a-z][a-z] [ 0-9][0-9] [0-9:]* kel.[0-9]+.: hello")));
    daemon.reset();
    unlink((scratch / "log").c_str());
    daemon.emplace(scratch / "log");
  }
}

TEST_F(LinuxSystemLogTest, MessagesThatTheDaemonDoesNotTakeAreCountedAndToldLaterOnce) {
  constexpr std::size_t sent = 10'000;  // far more than a socket holds
  for (std::size_t i = 0; i < sent; ++i) log.write("burst");
  const std::size_t lost = sent - daemon->received().size();
  ASSERT_GT(lost, 0u);
  log.write("next");
  log.write("last");
  EXPECT_THAT(daemon->received(), ElementsAre(EndsWith(": next [" + std::to_string(lost) +
                                                       " message(s) before this one were lost]"),
                                              EndsWith(": last")));
}

TEST_F(LinuxSystemLogTest, StandardErrorThatTakesNothingLosesMessagesButHoldsNobodyUp) {
  daemon.reset();
  unlink((scratch / "log").c_str());
  int ends[2];
  ASSERT_EQ(pipe(ends), 0);
  const OwnedDescriptor unread(ends[0]), kept(dup(STDERR_FILENO));
  dup2(ends[1], STDERR_FILENO);
  close(ends[1]);
  for (int i = 0; i < 2000; ++i) log.write(std::string(3000, 'x'));  // ends at all: nothing waited
  dup2(kept.get(), STDERR_FILENO);
  daemon.emplace(scratch / "log");
  log.write("next");
  EXPECT_THAT(daemon->received(), ElementsAre(ContainsRegex("next .[0-9]+ message.s. before this one")));
}

TEST(EscapedForLog, ControlCharactersAndIllFormedBytesBecomeOctalAndOverlongTextIsCut) {
  const std::pair<std::string, std::string> rows[] = {
      {std::string("a\nb\0del\x7f", 8), "a#012b#000del#177"},
      {"caf\xc3\xa9 \xef\xbf\xbd", "caf\xc3\xa9 \xef\xbf\xbd"},
      {"c1\xc2\x9b bad\xff\xc3", "c1#302#233 bad#377#303"},
      {std::string(3900, 'a'), std::string(3900, 'a')},
  };
  for (const auto& [text, escaped] : rows) EXPECT_EQ(escapedForLog(text), escaped);
  for (std::size_t shift = 0; shift < 4; ++shift) {
    std::string text(shift, 'a');
    for (int i = 0; i < 100'000; ++i) text += "\xf0\x9f\x98\x80";
    const std::string escaped = escapedForLog(text);
    EXPECT_TRUE(isValidUTF8(escaped) && escaped.ends_with("[cut]")) << shift;
    EXPECT_NEAR(static_cast<double>(escaped.size()), 3900, 10);
  }
}

TEST(LinuxTransactions, LauncherHearsOfReadinessAndThenOnlyOfChangesBetweenIdleAndBusy) {
  Scratch scratch;
  for (const std::string& name : {scratch / "notify", "@kel-test-" + std::to_string(getpid())}) {
    LinuxTransactions transactions(name);
    transactions.trackActivity();  // a report that is not taken is made up for
    Daemon launcher(name);
    {
      const Transaction first(transactions);
      const Transaction second(first);
      EXPECT_THAT(launcher.received(), ElementsAre("READY=1\nSTATUS=busy"));
    }
    EXPECT_THAT(launcher.received(), ElementsAre("STATUS=idle"));
  }
}

TEST(LinuxTransactions, LastReportIsTrueWhateverThreadsRaced) {
  Scratch scratch;
  Daemon launcher(scratch / "notify");
  LinuxTransactions transactions(scratch / "notify");
  transactions.trackActivity();
  std::atomic<int> running = 4;
  std::vector<std::thread> threads;
  for (int i = 0; i < 4; ++i) {
    threads.emplace_back([&] {
      for (int j = 0; j < 2000; ++j) const Transaction transaction(transactions);
      --running;
    });
  }
  while (running > 0) launcher.received();
  for (std::thread& thread : threads) thread.join();
  launcher.received();
  // A report that met a full socket is made up for by this.
  { const Transaction flush(transactions); }
  EXPECT_THAT(launcher.received(), testing::Contains("STATUS=idle"));
}

}  // namespace
}  // namespace kel::platform
