#include "platform/linux/process_confinement.h"

#include <functional>
#include <gtest/gtest.h>
#include <sched.h>
#include <signal.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include "platform/linux/linux_peer_process.h"
#include "platform/linux/linux_sandbox_query.h"
#include "platform/linux/scratch.h"

namespace kel::platform {
namespace {

OwnedDescriptor processDescriptor(pid_t pid) {
  return OwnedDescriptor(static_cast<int>(syscall(SYS_pidfd_open, pid, 0)));
}

/// A child that prepares itself and then waits to be ended.
class Child {
 public:
  explicit Child(const std::function<bool()>& prepare = [] { return true; }) {
    int ends[2];
    if (pipe(ends) != 0) throw std::runtime_error("pipe");
    const OwnedDescriptor ready(ends[0]);
    OwnedDescriptor told(ends[1]);
    pid_ = fork();
    if (pid_ == 0) {
      const char answer = prepare() ? 'y' : 'n';
      if (::write(told.get(), &answer, 1) == 1) pause();
      _exit(0);
    }
    told.reset();
    char answer = 'n';
    prepared_ = ::read(ready.get(), &answer, 1) == 1 && answer == 'y';
    descriptor_ = processDescriptor(pid_);
  }
  ~Child() { end(); }

  bool prepared() const { return prepared_; }
  int check() {
    return LinuxSandboxQuery().check(LinuxPeerProcess(pid_, OwnedDescriptor(dup(descriptor_.get()))));
  }

  /// Ends the process; its id stays taken until it is waited for.
  void kill() {
    ::kill(pid_, SIGKILL);
    siginfo_t info{};
    waitid(P_PID, static_cast<id_t>(pid_), &info, WEXITED | WNOWAIT);
  }
  void end() {
    if (std::exchange(ended_, true)) return;
    ::kill(pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
  }

 private:
  pid_t pid_ = -1;
  bool prepared_ = false;
  bool ended_ = false;
  OwnedDescriptor descriptor_;
};

TEST(LinuxSandboxQuery, OwnProcessAndAnOrdinaryChildAreNotSandboxed) {
  const LinuxPeerProcess own(getpid(), processDescriptor(getpid()));
  EXPECT_EQ(LinuxSandboxQuery().check(own), 0);
  EXPECT_EQ(Child().check(), 0);
}

TEST(LinuxSandboxQuery, ProcessOfAnotherUserNamespaceIsSandboxed) {
  Child child([] { return unshare(CLONE_NEWUSER) == 0; });
  if (!child.prepared()) GTEST_SKIP() << "the kernel refuses user namespaces";
  EXPECT_EQ(child.check(), 1);
}

TEST(LinuxSandboxQuery, ProcessWithAnotherRootIsSandboxed) {
  Scratch scratch;
  Child child([&scratch] { return chroot(scratch.path().c_str()) == 0; });
  if (!child.prepared()) GTEST_SKIP() << "only root may change the root directory";
  EXPECT_EQ(child.check(), 1);
}

TEST(LinuxSandboxQuery, ProcessThatHasEndedOrCannotBeHeldIsSandboxed) {
  Child zombie;
  zombie.kill();
  EXPECT_EQ(zombie.check(), 1);
  zombie.end();
  EXPECT_EQ(zombie.check(), 1);
  EXPECT_EQ(LinuxSandboxQuery().check(LinuxPeerProcess(getpid(), OwnedDescriptor())), 1);
  EXPECT_TRUE(isSandboxed(0, -1));
  EXPECT_TRUE(isSandboxed(-1, -1));
}

TEST(ProcessConfinement, ScopesOfSandboxedRuntimesAreTold) {
  const std::pair<const char*, bool> rows[] = {
      {"0::/user.slice/app.slice/app-flatpak-org.example.App-12.scope\n", true},
      {"0::/user.slice/flatpak-1234.scope", true},
      {"1:name=systemd:/a/snap.editor.editor-1.scope/inner\n0::/\n", true},
      {"0::/system.slice/snap.daemon.service\n", true},
      {"0::/user.slice/app.slice/flatpak-portal.service\n", false},
      {"0::/user.slice/app-org.example.flatpak-helper.scope\n", false},
      {"8:pids:/\n0::/init.scope\n", false},
      {"", false},
  };
  for (const auto& [text, sandboxed] : rows) EXPECT_EQ(namesSandboxScope(text), sandboxed) << text;
}

TEST(ProcessConfinement, LabelConfinesUnlessItSaysOtherwiseOrIsTheServersOwn) {
  struct Row {
    const char* label;
    const char* own;
    bool confines;
  };
  const Row rows[] = {
      {"", "", false},
      {"unconfined", "", false},
      {"browser (unconfined)", "unconfined", false},
      {"snap.editor.editor (enforce)", "unconfined", true},
      {"container (enforce)", "container (enforce)", false},
      {"inner (enforce)", "container (enforce)", true},
      {"unconfined_u:unconfined_r:unconfined_t:s0-s0:c0.c1023", "", false},
      {"system_u:system_r:container_t:s0:c1,c2", "unconfined_u:unconfined_r:unconfined_t:s0", true},
  };
  for (const Row& row : rows) EXPECT_EQ(isConfiningLabel(row.label, row.own), row.confines) << row.label;
}

}  // namespace
}  // namespace kel::platform
