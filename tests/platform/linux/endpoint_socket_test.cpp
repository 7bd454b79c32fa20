#include "platform/linux/endpoint_socket.h"

#include <cstdlib>
#include <fcntl.h>
#include <fstream>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include "conduit_fixture.h"

namespace kel::platform {
namespace {

using testing::EndsWith;

class EndpointTest : public ConduitTest {
 protected:
  /// Who gets the endpoint when another server starts now.
  std::string outcome() {
    ConduitListening second = conduit.listen(endpointName, queue, [](const ConduitEvent&) {});
    queue.sync([&] { second.listener.reset(); });
    const bool saysSo = second.error == socketPath() + ": another server holds the endpoint";
    EXPECT_EQ(second.servedElsewhere, saysSo) << second.error;
    return second.servedElsewhere ? "served elsewhere" : second.error.empty() ? "bound" : "error";
  }

  /// A socket file at the endpoint's place that does not go with its socket.
  OwnedDescriptor foreignSocket() {
    EndpointBinding binding = bindEndpoint(otherPath);
    EXPECT_TRUE(binding.socket);
    OwnedDescriptor copy(fcntl(binding.socket->get(), F_DUPFD_CLOEXEC, 0));
    EXPECT_EQ(link(otherPath.c_str(), socketPath().c_str()), 0);
    return copy;
  }

  const std::string otherPath = directory.path() + "/other";
};

TEST_F(EndpointTest, ALiveServerKeepsTheEndpointAndADeadOneLosesIt) {
  startServer();
  EXPECT_EQ(outcome(), "served elsewhere");
  EXPECT_TRUE(isServing());
  // Whoever removes the lock file does not free the endpoint.
  ASSERT_EQ(unlink((socketPath() + ".lock").c_str()), 0);
  EXPECT_EQ(outcome(), "served elsewhere");
  EXPECT_TRUE(isServing());
  stopServer();
  EXPECT_NE(access(socketPath().c_str(), F_OK), 0);

  OwnedDescriptor foreign = foreignSocket();
  EXPECT_EQ(outcome(), "served elsewhere");
  foreign.reset();
  EXPECT_EQ(outcome(), "bound");

  std::ofstream(socketPath()) << "no socket";
  EXPECT_EQ(outcome(), "error");
  EXPECT_EQ(access(socketPath().c_str(), F_OK), 0) << "a file that is no socket was removed";
}

TEST_F(EndpointTest, OnlyTheUserMayConnectWhateverTheFileCreationMask) {
  for (const mode_t mask : {mode_t{0}, mode_t{0777}}) {
    const mode_t before = umask(mask);
    startServer();
    umask(before);
    struct stat status {};
    ASSERT_EQ(stat(socketPath().c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777, 0600U);
    stopServer();
    unlink((socketPath() + ".lock").c_str());
  }
}

TEST_F(EndpointTest, OfTheLaunchersSocketsTheOneThatListensAndBearsTheNameIsUsed) {
  const auto passed = [](int type) { return socket(AF_UNIX, type, 0); };
  EndpointBinding other = bindEndpoint(otherPath);
  EndpointBinding ours = bindEndpoint(socketPath());
  ASSERT_TRUE(other.socket && ours.socket);
  // Consecutive numbers, as a launcher passes them.
  const int first = 200;
  const OwnedDescriptor inet(socket(AF_INET, SOCK_STREAM, 0)), datagram(passed(SOCK_DGRAM)),
      idle(passed(SOCK_STREAM));
  int next = first;
  for (const int each : {inet.get(), datagram.get(), idle.get(), other.socket->get(), ours.socket->get()}) {
    ASSERT_EQ(dup2(each, next), next);
    ++next;
  }
  const std::string name = endpointName;
  startServer({first, 5, name + ":" + name + ":" + name + ":other:" + name});
  EXPECT_TRUE(isServing());
  EXPECT_EQ(fcntl(first, F_GETFD), FD_CLOEXEC);
  stopServer();
  EXPECT_EQ(fcntl(first + 4, F_GETFD), -1) << "another socket than the fifth was taken";
  EXPECT_EQ(access(socketPath().c_str(), F_OK), 0) << "the launcher's socket file was removed";
  for (int each = first; each < first + 4; ++each) close(each);
}

TEST(LauncherSocketsTest, OnlyWhatIsMeantForThisProcessIsTakenAndTheVariablesAreRemoved) {
  const std::string self = std::to_string(getpid());
  const struct {
    std::string process, count;
    int taken;
  } rows[] = {{self, "2", 2},           {"1", "2", 0}, {self, "", 0},      {self, "-1", 0}, {self, "2x", 0},
              {self, "99999999999", 0}, {"", "2", 0},  {self, "100000", 0}};
  for (const auto& row : rows) {
    SCOPED_TRACE(row.process + "/" + row.count);
    setenv("LISTEN_PID", row.process.c_str(), 1);
    setenv("LISTEN_FDS", row.count.c_str(), 1);
    setenv("LISTEN_FDNAMES", "a:b", 1);
    EXPECT_EQ(takeLauncherSockets().count, row.taken);
    for (const char* name : {"LISTEN_PID", "LISTEN_FDS", "LISTEN_FDNAMES"}) EXPECT_EQ(getenv(name), nullptr);
  }
}

TEST(RuntimeDirectoryTest, OnlyADirectoryThatNobodyElseCanWriteToIsUsed) {
  const ScratchDirectory scratch;
  const std::string path = scratch.path() + "/kel";
  const auto mode = [&path] {
    struct stat status {};
    return stat(path.c_str(), &status) == 0 ? status.st_mode & 07777 : 0;
  };
  const mode_t before = umask(0777);
  EXPECT_EQ(makeRuntimeDirectory(path).path, path);
  umask(before);
  EXPECT_EQ(mode(), 0700U);
  ASSERT_EQ(chmod(path.c_str(), 0755), 0);
  EXPECT_EQ(makeRuntimeDirectory(path).path, path);
  EXPECT_EQ(mode(), 0700U);

  ASSERT_EQ(chmod(path.c_str(), 0720), 0);
  EXPECT_THAT(makeRuntimeDirectory(path).error, EndsWith("kel: others may write to it"));
  const std::string link = scratch.path() + "/link", file = scratch.path() + "/file";
  ASSERT_EQ(chmod(path.c_str(), 0700), 0);
  ASSERT_EQ(symlink(path.c_str(), link.c_str()), 0);
  std::ofstream(file) << "x";
  for (const std::string& wrong : {link, file, scratch.path() + "/missing/kel"}) {
    EXPECT_EQ(makeRuntimeDirectory(wrong).path, std::nullopt) << wrong;
  }
  if (geteuid() == 0 && chown(path.c_str(), 12345, 12345) == 0) {
    EXPECT_THAT(makeRuntimeDirectory(path).error, EndsWith("belongs to another user"));
  }
}

}  // namespace
}  // namespace kel::platform
