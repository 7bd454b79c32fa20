#include <fcntl.h>
#include <sys/resource.h>
#include <sys/time.h>
#include <thread>

#include "platform/linux/conduit/linux_conduit.h"
#include "platform/linux/scratch.h"
#include "property_lists/property_list.h"
#include "support/conduit_ends.h"
#include "support/manual_clock.h"

namespace kel::platform {
namespace {

using namespace std::chrono_literals;
using testing::ElementsAre;
using testing::EndsWith;
using testing::HasSubstr;
using testing::IsEmpty;

constexpr const char* endpointName = "com.orvex.kel.fetch_services";

Bytes rawFrame(std::uint32_t length, std::uint32_t kind, std::uint64_t tag, BytesView payload) {
  Bytes frame;
  for (const std::uint64_t number : {std::uint64_t{length} << 32 | kind, tag}) {
    for (int shift = 56; shift >= 0; shift -= 8) frame.push_back(static_cast<std::uint8_t>(number >> shift));
  }
  frame.insert(frame.end(), payload.begin(), payload.end());
  return frame;
}

Bytes requestFrame(std::uint64_t tag, const PropertyListValue& contents) {
  const Bytes bytes = *writeBinaryPropertyList(contents).bytes;
  return rawFrame(static_cast<std::uint32_t>(bytes.size()), 1, tag, bytes);
}

/// A peer that speaks bytes. Every wait has a generous limit, after which it counts as failed.
class RawPeer {
 public:
  explicit RawPeer(const std::string& path) : RawPeer(connectToEndpoint(path, 0)) {}
  explicit RawPeer(OwnedDescriptor connected) : socket_(std::move(connected)) {
    EXPECT_TRUE(socket_);
    const timeval limit{30, 0};
    setsockopt(socket_.get(), SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit);
  }

  int get() const { return socket_.get(); }

  /// The server may close before everything is sent; what that means is for the test to check.
  void send(BytesView bytes) { ::send(get(), bytes.data(), bytes.size(), MSG_NOSIGNAL); }
  void request(std::uint64_t tag, const PropertyListValue& contents) { send(requestFrame(tag, contents)); }

  /// Up to `count` bytes, fewer when the other end closed the connection first.
  Bytes receive(std::size_t count) {
    Bytes bytes(count);
    const ssize_t got = count == 0 ? 0 : recv(get(), bytes.data(), count, MSG_WAITALL);
    EXPECT_TRUE(got >= 0 || errno == ECONNRESET) << "nothing came for half a minute";
    bytes.resize(got > 0 ? static_cast<std::size_t>(got) : 0);
    return bytes;
  }

  bool isClosed() { return receive(1).empty(); }

  /// The next reply's contents, checked to carry `tag`; absent for a dropped frame.
  std::optional<PropertyListValue> reply(std::uint64_t tag) {
    const Bytes header = receive(16);
    if (header.size() < 16) return "closed by the server";
    std::size_t length = 0;
    for (const std::uint8_t byte : BytesView(header).first(4)) length = length << 8 | byte;
    EXPECT_EQ(header, rawFrame(static_cast<std::uint32_t>(length), length == 0 ? 3 : 2, tag, {}));
    return length == 0 ? std::nullopt : readBinaryPropertyList(receive(length)).value;
  }

 private:
  OwnedDescriptor socket_;
};

/// The echoing server, told of with what comes over raw connections and the conduit's own.
class ConduitTest : public ScratchTest, protected test::EchoingServer {
 protected:
  ConduitTest() : EchoingServer(getpid()) {}
  ~ConduitTest() override { stop(); }

  LinuxConduit makeConduit(LauncherSockets passed = {}) {
    LinuxConduit::Environment environment;
    environment.runtimeDirectory = [this] { return makePrivateDirectory(scratch.path()); };
    environment.launcherSockets = [passed] { return passed; };
    return LinuxConduit(log, clock, std::move(environment));
  }

  /// Serves the endpoint, with the sockets that a launcher `passed`.
  void startServer(LauncherSockets passed = {}) {
    LinuxConduit conduit = makeConduit(std::move(passed));
    serve(conduit, endpointName);
  }

  /// Waits until `count` requests have arrived and the server has taken whatever else it would take.
  std::size_t awaitRequests(std::size_t count) {
    EXPECT_TRUE(await(count));
    EXPECT_TRUE(isServing());
    const std::lock_guard lock(mutex);
    return --requests;
  }

  /// True when a new client is served.
  bool isServing() {
    RawPeer client(socketPath);
    client.request(7, "still there?");
    return client.reply(7) == PropertyListValue("still there?");
  }

  const std::string socketPath = scratch / endpointName;
  test::ManualClock clock;
};

TEST_F(ConduitTest, AMalformedMessageEndsItsConnectionWithOneLineAndASilentOrHalfSentOneHoldsUpNobody) {
  startServer();
  const RawPeer silent(socketPath);
  RawPeer bystander(socketPath);
  const Bytes request = requestFrame(3, Bytes(300'000, 'r'));
  bystander.send(BytesView(request).first(15));
  const Bytes garbage(8, 'g');
  const std::pair<Bytes, const char*> rows[] = {
      {rawFrame(8, 2, 1, garbage), "unexpected frame kind 2"},
      {rawFrame(0, 1, 1, {}), "frame length 0"},
      {rawFrame((1U << 20) + 1, 1, 1, {}), "frame length 1048577"},
      {rawFrame(0xFFFFFFFF, 1, 1, {}), "frame length 4294967295"},
      {rawFrame(8, 1, 1, garbage), "malformed message"},
  };
  for (const auto& [bytes, complaint] : rows) {
    SCOPED_TRACE(complaint);
    RawPeer client(socketPath);
    client.send(bytes);
    EXPECT_TRUE(client.isClosed());
    queue.sync([] {});
    EXPECT_THAT(log.take(), ElementsAre(HasSubstr(complaint)));
  }
  bystander.send(BytesView(request).subspan(15));
  EXPECT_TRUE(bystander.reply(3) == PropertyListValue(Bytes(300'000, 'r')));
  const std::lock_guard lock(mutex);
  EXPECT_EQ(errors, std::vector<std::string>(std::size(rows), "Connection invalid"));
}

TEST_F(ConduitTest, AMessageThatStaysHalfSentForTenSecondsEndsItsConnection) {
  startServer();
  RawPeer client(socketPath);
  const Bytes request = requestFrame(1, "never finished");
  client.send(BytesView(request).first(5));
  ASSERT_TRUE(clock.awaitTimers(1));
  client.send(BytesView(request).subspan(5, 5));
  clock.advance(10s);
  ASSERT_TRUE(clock.awaitTimers(1)) << "closed though more had come";
  EXPECT_THAT(log.messages(), IsEmpty());
  clock.advance(10s);
  EXPECT_TRUE(client.isClosed());
  EXPECT_THAT(log.messages(), ElementsAre(HasSubstr("half sent")));
}

TEST_F(ConduitTest, OnlyAReaderThatTakesNothingForAMinuteIsDisconnectedAndNoneHoldsUpOthers) {
  startServer();
  RawPeer slow(socketPath), deaf(socketPath);
  for (std::uint64_t tag = 1; tag <= 3; ++tag) slow.request(tag, "big");
  EXPECT_EQ(awaitRequests(1), 1U) << "the server piles up answers that nobody takes";
  deaf.request(1, "big");
  for (int i = 0; i < 6; ++i) {
    ASSERT_TRUE(clock.awaitTimers(2));
    EXPECT_THAT(log.messages(), IsEmpty());
    EXPECT_TRUE(i != 4 || slow.reply(1) == big);
    clock.advance(10s);
  }
  queue.sync([] {});  // before what is drained below counts as taken
  EXPECT_LT(deaf.receive(10'000'000).size(), 10'000'000U);
  EXPECT_THAT(log.messages(), ElementsAre(HasSubstr("not taken")));
  for (std::uint64_t tag = 2; tag <= 3; ++tag) EXPECT_TRUE(slow.reply(tag) == big);
}

TEST_F(ConduitTest, NoMoreThanEightRequestsOfAClientAreInFlightAndEachIsAnsweredAtMostOnce) {
  startServer();
  std::optional<RawPeer> client(socketPath);
  for (std::uint64_t tag = 0; tag <= 9; ++tag) client->request(tag, "hold");
  EXPECT_EQ(awaitRequests(8), 8U);
  {
    const std::lock_guard lock(mutex);
    EXPECT_FALSE(held[0]->canReply());
    held[0]->reply("nobody asked");
    held[1]->reply("done");
    held[1]->reply("a second reply");
    held[2].reset();
  }
  EXPECT_EQ(client->reply(1), PropertyListValue("done"));
  EXPECT_EQ(client->reply(2), std::nullopt);
  EXPECT_EQ(awaitRequests(10), 10U);
  client.reset();
  EXPECT_TRUE(isServing());
  const std::lock_guard lock(mutex);
  EXPECT_EQ(errors[0], "Connection invalid");
  held[3]->reply("too late");
}

TEST_F(ConduitTest, WithoutDescriptorsAConnectionIsGivenUpAndTheServerGoesOn) {
#if defined(__has_feature)
#if __has_feature(undefined_behavior_sanitizer) || __has_feature(address_sanitizer)
  GTEST_SKIP() << "the sanitizer needs descriptors of its own to look at an object";
#endif
#endif
  startServer();
  OwnedDescriptor doomed(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  queue.sync([] {});
  rlimit before{};
  getrlimit(RLIMIT_NOFILE, &before);
  const rlimit used{static_cast<rlim_t>(OwnedDescriptor(dup(0)).get()), before.rlim_max};
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &used), 0);
  const auto address = unixAddress(socketPath);
  EXPECT_EQ(connect(doomed.get(), address->get(), address->length), 0);
  EXPECT_TRUE(RawPeer(std::move(doomed)).isClosed());
  setrlimit(RLIMIT_NOFILE, &before);
  EXPECT_TRUE(isServing());
  EXPECT_THAT(log.messages(), ElementsAre(HasSubstr("out of descriptors")));
}

TEST_F(ConduitTest, BusyConnectionsBeyondTheLimitAreRefusedAndAnIdleOneGivesWay) {
  rlimit before{};
  getrlimit(RLIMIT_NOFILE, &before);
  const rlimit few{64, before.rlim_max};  // a quarter of them may be connections
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &few), 0);
  startServer();
  queue.sync([] {});
  setrlimit(RLIMIT_NOFILE, &before);
  std::vector<RawPeer> peers;
  for (int i = 0; i < 16; ++i) peers.emplace_back(socketPath).request(1, "hold");
  ASSERT_TRUE(await(16));
  EXPECT_TRUE(RawPeer(socketPath).isClosed());
  EXPECT_THAT(log.take(), ElementsAre(HasSubstr("too many busy connections")));
  {
    const std::lock_guard lock(mutex);
    held[0]->reply("done");
  }
  EXPECT_EQ(peers[0].reply(1), PropertyListValue("done"));
  EXPECT_TRUE(isServing());
  EXPECT_TRUE(peers[0].isClosed());
}

TEST_F(ConduitTest, ATooLargeRequestIsNotSent) {
  startServer();
  LinuxConduit conduit = makeConduit();
  test::SendingClient client(conduit, endpointName);
  EXPECT_EQ(client.send(Bytes(1U << 20, 'r')), "The request is too large");
  EXPECT_EQ(client.send("next"), "next");
}

TEST_F(ConduitTest, AServerThatSpeaksNonsenseInterruptsTheRequest) {
  const Bytes payload = *writeBinaryPropertyList("good").bytes;
  const auto length = static_cast<std::uint32_t>(payload.size());
  const Bytes rows[] = {
      {},                                                   // nothing
      rawFrame(length, 2, 1, BytesView(payload).first(9)),  // half a reply
      rawFrame(length, 2, 2, payload),                      // a reply to something else
      rawFrame(4, 2, 1, Bytes(4, 'g')),                     // garbage in a reply
      rawFrame((1U << 30) + 1, 2, 1, {}),                   // a reply of more than 1 GiB
      rawFrame(length, 3, 1, payload),                      // a dropped frame with a payload
  };
  const EndpointBinding binding = bindEndpoint(socketPath);
  LinuxConduit conduit = makeConduit();
  for (const Bytes& answer : rows) {
    test::SendingClient client(conduit, endpointName);
    std::thread answerer([&] {
      RawPeer peer(OwnedDescriptor(accept4(binding.socket->get(), nullptr, nullptr, 0)));
      peer.receive(requestFrame(1, "hello").size());
      peer.send(answer);
    });
    EXPECT_EQ(client.send("hello"), "Connection interrupted") << &answer - rows;
    answerer.join();
  }
}

TEST_F(ConduitTest, ALiveServerKeepsTheEndpointAndADeadOneLosesIt) {
  const auto outcome = [this] {
    const EndpointBinding second = bindEndpoint(socketPath);
    EXPECT_EQ(second.servedElsewhere, second.error == socketPath + ": another server holds the endpoint");
    return second.servedElsewhere ? "served elsewhere" : second.error.empty() ? "bound" : "error";
  };
  startServer();
  EXPECT_EQ(scratch.mode(endpointName), 0600U);
  EXPECT_EQ(outcome(), "served elsewhere");
  ASSERT_EQ(unlink((socketPath + ".lock").c_str()), 0);
  EXPECT_EQ(outcome(), "served elsewhere") << "whoever removes the lock file does not free the endpoint";
  EXPECT_TRUE(isServing());
  stop();
  EXPECT_FALSE(files.exists(socketPath));
  {
    const EndpointBinding dying = bindEndpoint(scratch / "other");
    ASSERT_EQ(link((scratch / "other").c_str(), socketPath.c_str()), 0);
    EXPECT_EQ(outcome(), "served elsewhere");
  }
  EXPECT_EQ(outcome(), "bound");

  scratch.write(endpointName, "no socket");
  EXPECT_EQ(outcome(), "error");
  EXPECT_EQ(scratch.read(endpointName), "no socket");
  EXPECT_THAT(bindEndpoint(scratch / std::string(150, 'n')).error, EndsWith("File name too long"));
}

TEST_F(ConduitTest, OfTheLaunchersSocketsTheOneThatListensAndBearsTheNameIsUsed) {
  EndpointBinding other = bindEndpoint(scratch / "other"), ours = bindEndpoint(socketPath);
  const OwnedDescriptor inet(socket(AF_INET, SOCK_STREAM, 0)), idle(socket(AF_UNIX, SOCK_STREAM, 0));
  constexpr int first = 200;  // consecutive numbers, as a launcher passes them
  int next = first;
  for (const int each : {inet.get(), idle.get(), other.socket->get(), ours.socket->get()}) {
    ASSERT_EQ(dup2(each, next), next);
    ++next;
  }
  const std::string name = endpointName;
  startServer({first, 4, name + ":" + name + ":other:" + name});
  EXPECT_TRUE(isServing());
  EXPECT_EQ(fcntl(first, F_GETFD), FD_CLOEXEC);
  stop();
  EXPECT_EQ(fcntl(first + 3, F_GETFD), -1) << "another socket than the fourth was taken";
  EXPECT_TRUE(files.exists(socketPath)) << "the launcher's socket file was removed";
  for (int each = first; each < first + 3; ++each) close(each);
}

}  // namespace
}  // namespace kel::platform
