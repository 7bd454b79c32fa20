#include <array>
#include <fcntl.h>
#include <fstream>
#include <poll.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <thread>
#include <unistd.h>

#include "conduit_fixture.h"
#include "platform/linux/endpoint_socket.h"
#include "platform/linux/linux_peer_process.h"
#include "platform/property_list.h"

namespace kel::platform {
namespace {

using namespace std::chrono_literals;
using testing::Each;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::SizeIs;

/// The soft limit on descriptors, put back at the end.
class DescriptorLimit {
 public:
  explicit DescriptorLimit(rlim_t limit) {
    getrlimit(RLIMIT_NOFILE, &before_);
    const rlimit lowered{limit, before_.rlim_max};
    EXPECT_EQ(setrlimit(RLIMIT_NOFILE, &lowered), 0);
  }
  ~DescriptorLimit() { setrlimit(RLIMIT_NOFILE, &before_); }

  static rlim_t inUse() { return static_cast<rlim_t>(OwnedDescriptor(dup(0)).get()); }

 private:
  rlimit before_{};
};

TEST_F(ConduitTest, EveryClientGetsTheRepliesToItsOwnRequests) {
  startServer();
  std::vector<std::thread> clients;
  for (int i = 0; i < 4; ++i) {
    clients.emplace_back([this, i] {
      SerialQueue contact("kel contact queue");
      const auto connection = conduit.connect(endpointName, contact);
      connection->start();
      for (int j = 0; j < 50; ++j) {
        const PropertyListValue text((j % 2 == 0 ? "elsewhere " : "here ") + std::to_string(100 * i + j));
        const ConduitReply reply = connection->sendAndWait(text);
        ASSERT_TRUE(std::holds_alternative<PropertyListValue>(reply));
        EXPECT_EQ(std::get<PropertyListValue>(reply), text);
      }
    });
  }
  for (auto& client : clients) client.join();
  EXPECT_THAT(peers, testing::AllOf(SizeIs(4), Each(getpid())));
}

TEST_F(ConduitTest, AMalformedMessageEndsItsConnectionWithOneLineAndNoOther) {
  startServer();
  RawClient bystander(socketPath());
  const std::string good = "bplist00";
  const struct {
    const char* name;
    Bytes bytes;
    const char* complaint;
  } rows[] = {
      {"text", Bytes(16, 'x'), "unexpected frame kind"},
      {"kind 0", rawFrame(1, 0, 1, "x"), "unexpected frame kind 0"},
      {"a reply", rawFrame(1, 2, 1, "x"), "unexpected frame kind 2"},
      {"a dropped frame", rawFrame(0, 3, 1, ""), "unexpected frame kind 3"},
      {"no payload", rawFrame(0, 1, 1, ""), "frame length 0"},
      {"a byte too many", rawFrame((1U << 20) + 1, 1, 1, ""), "frame length 1048577"},
      {"a giant", rawFrame(0xFFFFFFFF, 1, 1, ""), "frame length 4294967295"},
      {"garbage in a frame", rawFrame(8, 1, 1, good), "malformed message"},
      {"garbage after a request", rawFrame(8, 1, 0, "bplist99"), "malformed message"},
  };
  std::size_t lines = 0;
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    RawClient client(socketPath());
    client.send(row.bytes);
    EXPECT_TRUE(client.isClosedByServer());
    queue.sync([] {});
    const std::lock_guard lock(mutex);
    ASSERT_THAT(log.lines(), SizeIs(++lines));
    EXPECT_THAT(log.lines().back(), HasSubstr(row.complaint));
    EXPECT_THAT(errors, testing::AllOf(SizeIs(lines), Each("Connection invalid")));
  }
  bystander.sendRequest(3, "well-behaved");
  EXPECT_EQ(bystander.receiveReply(3), PropertyListValue("well-behaved"));
}

TEST_F(ConduitTest, ARequestIsReadHoweverItIsCutAndASilentOrHalfSentOneHoldsUpNobody) {
  startServer();
  RawClient silent(socketPath()), slow(socketPath());
  const Bytes request = requestFrame(9, Bytes(300'000, 'r'));
  for (const auto& [begin, end] :
       {std::pair<std::size_t, std::size_t>{0, 1}, {1, 15}, {15, 17}, {17, 250'000}}) {
    slow.send(BytesView(request).subspan(begin, end - begin));
    EXPECT_TRUE(isServing());
  }
  slow.send(BytesView(request).subspan(250'000));
  EXPECT_EQ(slow.receiveReply(9), PropertyListValue(Bytes(300'000, 'r')));
}

TEST_F(ConduitTest, AMessageThatStaysHalfSentForTenSecondsEndsItsConnection) {
  startServer();
  RawClient client(socketPath());
  const Bytes request = requestFrame(1, "never finished");
  client.send(BytesView(request).first(5));
  ASSERT_TRUE(clock.awaitTimers(1));
  client.send(BytesView(request).subspan(5, 5));
  clock.advance(10s);
  ASSERT_TRUE(clock.awaitTimers(1)) << "closed though more had come";
  EXPECT_THAT(log.lines(), IsEmpty());
  clock.advance(10s);
  EXPECT_TRUE(client.isClosedByServer());
  EXPECT_THAT(log.lines(), ElementsAre(HasSubstr("half sent")));
}

TEST_F(ConduitTest, RequestsThatArriveTogetherAreAnsweredOneAfterTheOther) {
  startServer();
  RawClient client(socketPath());
  Bytes together;
  for (std::uint64_t tag = 1; tag <= 20; ++tag) {
    const Bytes frame = requestFrame(tag, static_cast<int>(tag));
    together.insert(together.end(), frame.begin(), frame.end());
  }
  client.send(together);
  for (std::uint64_t tag = 1; tag <= 20; ++tag) {
    EXPECT_EQ(client.receiveReply(tag), PropertyListValue(static_cast<int>(tag)));
  }
}

TEST_F(ConduitTest, DescriptorsThatSomebodySendsAreClosedAtOnce) {
  startServer();
  RawClient client(socketPath());
  std::array<int, 2> ends{};
  ASSERT_EQ(pipe2(ends.data(), O_CLOEXEC), 0);
  const OwnedDescriptor readEnd(ends[0]);
  OwnedDescriptor writeEnd(ends[1]);
  client.sendWithDescriptor(requestFrame(1, "take this"), writeEnd.get());
  EXPECT_EQ(client.receiveReply(1), PropertyListValue("take this"));
  writeEnd.reset();
  pollfd pipe{readEnd.get(), POLLIN, 0};
  EXPECT_EQ(poll(&pipe, 1, 0), 1) << "the server still has the descriptor";
}

TEST_F(ConduitTest, AReaderThatTakesNothingHoldsUpNobodyAndGetsItsAnswersInTheEnd) {
  startServer();
  RawClient slow(socketPath());
  for (std::uint64_t tag = 1; tag <= 3; ++tag) slow.sendRequest(tag, "big");
  EXPECT_EQ(awaitRequests(1), 1U) << "the server piles up answers that nobody takes";
  for (std::uint64_t tag = 1; tag <= 3; ++tag) {
    const auto reply = slow.receiveReply(tag);
    EXPECT_TRUE(reply == big);
  }
}

TEST_F(ConduitTest, AReaderThatTakesNothingForAMinuteIsDisconnected) {
  startServer();
  RawClient slow(socketPath());
  slow.sendRequest(1, "big");
  for (int i = 0; i < 6; ++i) {
    ASSERT_TRUE(clock.awaitTimers(1));
    EXPECT_THAT(log.lines(), IsEmpty());
    clock.advance(10s);
  }
  queue.sync([] {});  // before what is drained below counts as taken
  EXPECT_TRUE(slow.isClosedByServer());
  EXPECT_THAT(log.lines(), ElementsAre(HasSubstr("not taken")));
}

TEST_F(ConduitTest, NoMoreThanEightRequestsOfAClientAreInFlight) {
  startServer();
  RawClient client(socketPath());
  for (std::uint64_t tag = 1; tag <= 10; ++tag) client.sendRequest(tag, "hold");
  EXPECT_EQ(awaitRequests(8), 8U);
  {
    const std::lock_guard lock(mutex);
    held[0]->reply("done");
    held[0]->reply("a second reply");
    held[1].reset();
  }
  EXPECT_EQ(client.receiveReply(1), PropertyListValue("done"));
  EXPECT_EQ(client.receiveReply(2), std::nullopt);
  EXPECT_EQ(awaitRequests(10), 10U);
}

TEST_F(ConduitTest, ARequestWithoutATagIsPerformedAndNotAnswered) {
  startServer();
  RawClient client(socketPath());
  client.sendRequest(0, "hold");
  client.sendRequest(0, "drop");
  client.sendRequest(5, "next");
  EXPECT_EQ(client.receiveReply(5), PropertyListValue("next"));
  const std::lock_guard lock(mutex);
  ASSERT_THAT(held, SizeIs(1));
  EXPECT_FALSE(held[0]->canReply());
}

TEST_F(ConduitTest, AnAnswerToAClientThatHasGoneIsForgotten) {
  startServer();
  std::optional<RawClient> client(socketPath());
  client->sendRequest(1, "hold");
  awaitRequests(1);
  client.reset();
  EXPECT_TRUE(isServing());
  const std::lock_guard lock(mutex);
  EXPECT_THAT(errors, testing::Contains("Connection invalid"));
  held[0]->reply("too late");
}

TEST_F(ConduitTest, WithoutDescriptorsAConnectionIsGivenUpAndTheServerGoesOn) {
  startServer();
  OwnedDescriptor doomed(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  queue.sync([] {});
  {
    const DescriptorLimit limit(DescriptorLimit::inUse());
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    socketPath().copy(address.sun_path, sizeof address.sun_path - 1);
    ASSERT_EQ(connect(doomed.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    EXPECT_TRUE(RawClient(std::move(doomed)).isClosedByServer());
  }
  EXPECT_TRUE(isServing());
  EXPECT_THAT(log.lines(), ElementsAre(HasSubstr("out of descriptors")));
}

TEST_F(ConduitTest, WhereIdleConnectionsPileUpTheOldestGivesWay) {
  {
    const DescriptorLimit limit(64);
    startServer();
  }
  RawClient busy(socketPath());
  busy.sendRequest(1, "hold");
  awaitRequests(1);
  std::vector<std::unique_ptr<RawClient>> idle;
  for (int i = 0; i < 17; ++i) idle.push_back(std::make_unique<RawClient>(socketPath()));
  EXPECT_TRUE(idle.front()->isClosedByServer());
  EXPECT_TRUE(isServing());
  const std::lock_guard lock(mutex);
  held[0]->reply("kept");
  EXPECT_EQ(busy.receiveReply(1), PropertyListValue("kept"));
}

TEST_F(ConduitTest, ThePeerIsHeldByADescriptorOfItsProcess) {
  startServer();
  const OwnedDescriptor connected = connectToEndpoint(socketPath(), 0);
  const auto peer = LinuxPeerProcess::ofSocket(connected.get(), getpid());
  const std::string info = "/proc/self/fdinfo/" + std::to_string(peer->descriptor());
  std::ifstream file(info);
  const std::string text{std::istreambuf_iterator<char>(file), {}};
  EXPECT_THAT(text, HasSubstr("Pid:\t" + std::to_string(getpid()) + "\n"));
}

}  // namespace
}  // namespace kel::platform
