#include <sys/socket.h>
#include <thread>

#include "conduit_fixture.h"
#include "platform/linux/endpoint_socket.h"
#include "platform/property_list.h"

namespace kel::platform {
namespace {

using testing::ElementsAre;

std::string render(const ConduitReply& reply) {
  const auto* error = std::get_if<ConduitError>(&reply);
  if (!error) return describe(std::get<PropertyListValue>(reply));
  const bool isInvalid = error->kind == ConduitError::Kind::ConnectionInvalid;
  EXPECT_EQ(isInvalid, error->description == "Connection invalid");
  return error->description;
}

class ConduitClientTest : public ConduitTest {
 protected:
  void connect() {
    connection = conduit.connect(endpointName, *contact);
    connection->setEventHandler(
        [this](const ConduitEvent& event) { events.push_back(std::get<ConduitError>(event).description); });
    connection->start();
  }

  std::string send(const PropertyListValue& contents) { return render(connection->sendAndWait(contents)); }

  /// What went to the event handler until the connection and its queue were let go of.
  std::vector<std::string> eventsInTheEnd() {
    connection.reset();
    contact.reset();
    return events;
  }

  std::vector<std::string> events;  // on the contact queue
  std::unique_ptr<SerialQueue> contact = std::make_unique<SerialQueue>("kel contact queue");
  std::shared_ptr<ConduitConnection> connection;
};

TEST_F(ConduitClientTest, WithoutAServerTheConnectionIsInvalid) {
  connect();
  EXPECT_EQ(send("anyone?"), "Connection invalid");
  EXPECT_EQ(send("anyone?"), "Connection invalid");
  EXPECT_THAT(eventsInTheEnd(), ElementsAre("Connection invalid"));
}

TEST_F(ConduitClientTest, ADroppedRequestInterruptsOnlyItself) {
  startServer();
  connect();
  EXPECT_EQ(send("drop"), "Connection interrupted");
  EXPECT_EQ(send("drop"), "Connection interrupted");
  EXPECT_EQ(send("next"), "next");
  EXPECT_THAT(eventsInTheEnd(), ElementsAre("Connection interrupted"));
}

TEST_F(ConduitClientTest, AServerThatGoesInMidRequestInterruptsIt) {
  startServer();
  connect();
  std::string reply;
  std::thread sender([&] { reply = send("hold"); });
  awaitRequests(1);
  stopServer();
  sender.join();
  EXPECT_EQ(reply, "Connection interrupted");
  EXPECT_EQ(send("gone"), "Connection invalid");
  EXPECT_THAT(eventsInTheEnd(), ElementsAre("Connection interrupted"));
}

TEST_F(ConduitClientTest, ALargeReplyArrivesWholeAndALargeRequestIsRefused) {
  startServer();
  connect();
  EXPECT_TRUE(std::get<PropertyListValue>(connection->sendAndWait("big")) == big);
  const ConduitReply refused = connection->sendAndWait(Bytes(1U << 20, 'r'));
  ASSERT_TRUE(std::holds_alternative<ConduitError>(refused));
  EXPECT_EQ(std::get<ConduitError>(refused).kind, ConduitError::Kind::Other);
  EXPECT_EQ(send("next"), "next");
}

TEST_F(ConduitClientTest, AServerThatSpeaksNonsenseInterruptsTheRequest) {
  const Bytes good = *writeBinaryPropertyList("good").bytes;
  const std::string payload(good.begin(), good.end());
  const auto length = static_cast<std::uint32_t>(payload.size());
  const struct {
    const char* name;
    Bytes answer;
    const char* reply;
  } rows[] = {
      {"the expected reply", rawFrame(length, 2, 1, payload), "good"},
      {"nothing", {}, "Connection interrupted"},
      {"half a reply", rawFrame(length, 2, 1, payload.substr(0, 9)), "Connection interrupted"},
      {"a reply to something else", rawFrame(length, 2, 2, payload), "Connection interrupted"},
      {"a request", rawFrame(length, 1, 1, payload), "Connection interrupted"},
      {"garbage in a reply", rawFrame(4, 2, 1, "oops"), "Connection interrupted"},
      {"a reply of more than 1 GiB", rawFrame((1U << 30) + 1, 2, 1, ""), "Connection interrupted"},
      {"a dropped frame with a payload", rawFrame(length, 3, 1, payload), "Connection interrupted"},
  };
  EndpointBinding binding = bindEndpoint(socketPath());
  ASSERT_TRUE(binding.socket);
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    connect();
    OwnedDescriptor accepted(accept4(binding.socket->get(), nullptr, nullptr, SOCK_CLOEXEC));
    std::thread answerer([&] {
      RawClient peer(std::move(accepted));
      peer.receive(requestFrame(1, "hello").size());
      peer.send(row.answer);
    });
    EXPECT_EQ(send("hello"), row.reply);
    answerer.join();
  }
}

}  // namespace
}  // namespace kel::platform
