#include <optional>
#include <thread>

#include "platform/linux/conduit/linux_conduit.h"
#include "platform/linux/scratch.h"
#include "support/conduit_ends.h"
#include "support/in_memory_conduit.h"
#include "support/manual_clock.h"
#include "support/property_lists.h"

namespace kel::test {
namespace {

struct InMemoryEndpoints {
  InMemoryConduit conduit;
  const std::int64_t peer = conduit.nextPeer;
};

struct LinuxEndpoints {
  platform::Scratch scratch;
  RecordingLog log;
  ManualClock clock;
  platform::LinuxConduit conduit{
      log,
      clock,
      {.trackActivity = {},
       .runtimeDirectory = [this] { return platform::makePrivateDirectory(scratch.path()); },
       .launcherSockets = [] { return platform::LauncherSockets(); }}};
  const std::int64_t peer = getpid();
};

template <typename Endpoints>
class ConduitContractTest : public testing::Test {
 protected:
  Value sendTo(const char* name, const Value& contents) {
    return SendingClient(endpoints.conduit, name).send(contents);
  }

  Endpoints endpoints;
  EchoingServer server{endpoints.peer};
};
using AllEndpoints = testing::Types<InMemoryEndpoints, LinuxEndpoints>;
TYPED_TEST_SUITE(ConduitContractTest, AllEndpoints);

TYPED_TEST(ConduitContractTest, RequestsOfEveryKindAreAnsweredAndWhatIsDroppedOrLetGoOfIsTold) {
  this->server.serve(this->endpoints.conduit, "endpoint");
  std::optional<SendingClient> client(std::in_place, this->endpoints.conduit, "endpoint");
  SendingClient other(this->endpoints.conduit, "endpoint");
  for (const Value& value : Array{"text", 1, true, dictionary({{"key", "value"}}), Array{}})
    EXPECT_EQ(client->send(value), value);
  EXPECT_TRUE(client->send("big") == this->server.big);
  EXPECT_THAT(client->events(), IsEmpty());
  EXPECT_EQ(client->send("drop"), "Connection interrupted");
  EXPECT_THAT(client->events(), ElementsAre("Connection interrupted"));
  EXPECT_EQ(client->send("next"), "next");
  client.reset();
  EXPECT_TRUE(this->server.await(1, 1));
  EXPECT_EQ(other.send("still there?"), "still there?");
  this->server.stop();
  EXPECT_THAT(this->server.errors, ElementsAre("Connection invalid"));
}

TYPED_TEST(ConduitContractTest, AnEndpointHasOneServerAtATimeAndAnswersForNoOther) {
  SendingClient early(this->endpoints.conduit, "endpoint");
  EXPECT_EQ(early.send("hello"), "Connection invalid");
  EXPECT_THAT(early.events(), ElementsAre("Connection invalid"));
  this->server.serve(this->endpoints.conduit, "endpoint");
  EchoingServer second(this->endpoints.peer);
  const auto refused = this->endpoints.conduit.listen("endpoint", second.queue, {});
  EXPECT_TRUE(!refused.listener && refused.servedElsewhere && !refused.error.empty());
  EXPECT_EQ(this->sendTo("other", "hello"), "Connection invalid");
  second.serve(this->endpoints.conduit, "other");
  this->server.stop();
  EXPECT_EQ(this->sendTo("endpoint", "hello"), "Connection invalid");
  EXPECT_EQ(this->sendTo("other", "hello"), "hello");
  this->server.serve(this->endpoints.conduit, "endpoint");
  EXPECT_EQ(this->sendTo("endpoint", "hello"), "hello");
}

TYPED_TEST(ConduitContractTest, AServerThatGoesInterruptsWhoWaitsAndItsLateReplyReachesNobody) {
  this->server.serve(this->endpoints.conduit, "endpoint");
  SendingClient client(this->endpoints.conduit, "endpoint"), idle(this->endpoints.conduit, "endpoint");
  Value reply = 0;
  std::thread sender([&] { reply = client.send("hold"); });
  ASSERT_TRUE(this->server.await(1));
  this->server.stop();
  sender.join();
  EXPECT_EQ(reply, "Connection interrupted");
  this->server.held.at(0)->reply("too late");
  EXPECT_EQ(client.send("gone"), "Connection invalid");
  EXPECT_NE(idle.send("gone"), "gone");
  EXPECT_THAT(idle.events(), SizeIs(1));
  EXPECT_THAT(this->server.errors, IsEmpty());
}

}  // namespace
}  // namespace kel::test
