#include "platform/linux/linux_process.h"

#include <csignal>
#include <gtest/gtest.h>
#include <signal.h>
#include <string>
#include <sys/wait.h>
#include <unistd.h>

#include "platform/linux/owned_descriptor.h"

namespace kel::platform {
namespace {

/// Runs `body` in a child whose standard output is a pipe; gives what it printed and how it ended.
template <typename Body>
std::pair<std::string, int> runChild(Body body) {
  int ends[2];
  if (pipe(ends) != 0) return {"", -1};
  const OwnedDescriptor output(ends[0]);
  OwnedDescriptor input(ends[1]);
  fflush(stdout);
  const pid_t child = fork();
  if (child == 0) {
    dup2(input.get(), STDOUT_FILENO);
    body();
    _exit(99);
  }
  input.reset();
  std::string printed;
  char buffer[256];
  for (ssize_t length = 0; (length = read(output.get(), buffer, sizeof buffer)) > 0;) {
    printed.append(buffer, static_cast<std::size_t>(length));
  }
  int status = 0;
  waitpid(child, &status, 0);
  return {printed, status};
}

TEST(LinuxProcess, TerminationRunsTheHandlerThatEndsTheProcessAndKeepsWhatWasPrinted) {
  const auto [printed, status] = runChild([] {
    sigset_t inherited;
    sigemptyset(&inherited);
    sigaddset(&inherited, SIGTERM);
    sigprocmask(SIG_BLOCK, &inherited, nullptr);  // as a careless parent would leave it
    LinuxProcess process;
    process.onTermination([&process] { process.exitNow(0); });
    printf("printed");
    kill(getpid(), SIGTERM);
    process.runMainLoop();
  });
  EXPECT_EQ(printed, "printed");
  EXPECT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0);
}

TEST(LinuxProcess, WithoutAHandlerTheTerminationSignalEndsTheProcess) {
  const auto [printed, status] = runChild([] {
    LinuxProcess process;
    kill(getpid(), SIGTERM);
  });
  EXPECT_TRUE(WIFSIGNALED(status));
}

TEST(LinuxProcess, WritingToAClosedPipeFailsInsteadOfEndingTheProcess) {
  const auto [printed, status] = runChild([] {
    LinuxProcess process;
    int ends[2];
    if (pipe(ends) != 0) _exit(98);
    close(ends[0]);
    process.exitNow(::write(ends[1], "x", 1) == -1 ? 3 : 4);
  });
  EXPECT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 3);
}

}  // namespace
}  // namespace kel::platform
