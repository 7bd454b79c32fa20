#include "conduit_fixture.h"

#include <array>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <poll.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <unistd.h>
#include <utility>

#include "platform/linux/endpoint_socket.h"
#include "platform/property_list.h"

namespace kel::platform {

namespace {

using namespace std::chrono_literals;

constexpr auto generousLimit = 30s;

}  // namespace

ScratchDirectory::ScratchDirectory() {
  std::string name = testing::TempDir() + "/kelXXXXXX";
  path_ = mkdtemp(name.data());
}

RawClient::RawClient(const std::string& socketPath) : RawClient(connectToEndpoint(socketPath, 0)) {}

RawClient::RawClient(OwnedDescriptor connected) : socket_(std::move(connected)) {
  EXPECT_TRUE(socket_);
  const timeval limit{30, 0};
  setsockopt(socket_.get(), SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit);
  setsockopt(socket_.get(), SOL_SOCKET, SO_SNDTIMEO, &limit, sizeof limit);
}

void RawClient::send(BytesView bytes) {
  // The server may close before everything is sent; what that means is for the test to check.
  while (!bytes.empty()) {
    const ssize_t sent = ::send(socket_.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL);
    if (sent <= 0) return;
    bytes = bytes.subspan(static_cast<std::size_t>(sent));
  }
}

void RawClient::sendRequest(std::uint64_t tag, const PropertyListValue& contents) {
  send(requestFrame(tag, contents));
}

void RawClient::sendWithDescriptor(BytesView bytes, int descriptor) {
  iovec part{const_cast<std::uint8_t*>(bytes.data()), bytes.size()};
  alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof descriptor)> control{};
  msghdr message{};
  message.msg_iov = &part;
  message.msg_iovlen = 1;
  message.msg_control = control.data();
  message.msg_controllen = control.size();
  cmsghdr* header = CMSG_FIRSTHDR(&message);
  header->cmsg_level = SOL_SOCKET;
  header->cmsg_type = SCM_RIGHTS;
  header->cmsg_len = CMSG_LEN(sizeof descriptor);
  std::memcpy(CMSG_DATA(header), &descriptor, sizeof descriptor);
  EXPECT_EQ(sendmsg(socket_.get(), &message, MSG_NOSIGNAL), static_cast<ssize_t>(bytes.size()));
}

Bytes RawClient::receive(std::size_t count) {
  Bytes bytes(count);
  std::size_t filled = 0;
  while (filled < count) {
    const ssize_t got = recv(socket_.get(), bytes.data() + filled, count - filled, 0);
    EXPECT_TRUE(got >= 0 || errno == ECONNRESET) << "nothing came for half a minute";
    if (got <= 0) break;
    filled += static_cast<std::size_t>(got);
  }
  bytes.resize(filled);
  return bytes;
}

bool RawClient::isClosedByServer() {
  pollfd socket{socket_.get(), POLLIN, 0};
  while (poll(&socket, 1, 30'000) == 1) {
    std::array<char, 65536> rest;
    if (recv(socket_.get(), rest.data(), rest.size(), 0) <= 0) return true;
  }
  return false;
}

std::optional<PropertyListValue> RawClient::receiveReply(std::uint64_t tag) {
  const auto number = [](BytesView bytes) {
    std::uint64_t result = 0;
    for (const std::uint8_t byte : bytes) result = result << 8 | byte;
    return result;
  };
  const Bytes header = receive(16);
  if (header.size() < 16) return "closed by the server";
  const std::uint64_t kind = number(BytesView(header).subspan(4, 4));
  EXPECT_EQ(number(BytesView(header).subspan(8)), tag);
  const Bytes payload = receive(number(BytesView(header).first(4)));
  if (kind == 3 && payload.empty()) return std::nullopt;
  EXPECT_EQ(kind, 2U);
  return readBinaryPropertyList(payload).value;
}

Bytes rawFrame(std::uint32_t length, std::uint32_t kind, std::uint64_t tag, std::string_view payload) {
  Bytes frame;
  for (int shift = 24; shift >= 0; shift -= 8) frame.push_back(static_cast<std::uint8_t>(length >> shift));
  for (int shift = 24; shift >= 0; shift -= 8) frame.push_back(static_cast<std::uint8_t>(kind >> shift));
  for (int shift = 56; shift >= 0; shift -= 8) frame.push_back(static_cast<std::uint8_t>(tag >> shift));
  frame.insert(frame.end(), payload.begin(), payload.end());
  return frame;
}

Bytes requestFrame(std::uint64_t tag, const PropertyListValue& contents) {
  const Bytes bytes = *writeBinaryPropertyList(contents).bytes;
  return rawFrame(static_cast<std::uint32_t>(bytes.size()), 1, tag, std::string(bytes.begin(), bytes.end()));
}

LinuxConduit ConduitTest::makeConduit(LauncherSockets passed) {
  LinuxConduit::Environment environment;
  environment.trackActivity = [] {};
  environment.runtimeDirectory = [this] { return makeRuntimeDirectory(directory.path()); };
  environment.launcherSockets = [passed] { return passed; };
  return LinuxConduit(log, clock, std::move(environment));
}

void ConduitTest::startServer(LauncherSockets passed) {
  ConduitListening listening =
      makeConduit(std::move(passed)).listen(endpointName, queue, [this](const ConduitEvent& event) {
        handle(event);
      });
  ASSERT_EQ(listening.error, "");
  listener = std::move(listening.listener);
  ASSERT_NE(listener, nullptr);
}

void ConduitTest::stopServer() {
  queue.sync([&] { listener.reset(); });
}

void ConduitTest::handle(const ConduitEvent& event) {
  queue.assertCurrent();
  EXPECT_FALSE(std::exchange(handling, true)) << "an event inside the handling of another";
  if (const auto* connection = std::get_if<std::shared_ptr<ConduitConnection>>(&event)) {
    const std::lock_guard lock(mutex);
    peers.push_back((*connection)->peer()->processID());
    (*connection)->setEventHandler([this](const ConduitEvent& inner) { handle(inner); });
    (*connection)->start();
  } else if (const auto* error = std::get_if<ConduitError>(&event)) {
    const std::lock_guard lock(mutex);
    errors.push_back(error->description);
  } else {
    perform(std::get<std::shared_ptr<ConduitMessage>>(event));
  }
  handling = false;
  changed.notify_all();
}

void ConduitTest::perform(const std::shared_ptr<ConduitMessage>& message) {
  const std::string* text = message->contents().asString();
  const std::string what = text ? *text : "";
  {
    const std::lock_guard lock(mutex);
    ++requests;
    if (what == "hold") held.push_back(message);
  }
  if (what == "big") {
    message->reply(big);
  } else if (what.starts_with("elsewhere")) {
    otherQueue.async([message] { message->reply(message->contents()); });
  } else if (what != "hold" && what != "drop") {
    message->reply(message->contents());
  }
}

std::size_t ConduitTest::awaitRequests(std::size_t count) {
  std::unique_lock lock(mutex);
  EXPECT_TRUE(changed.wait_for(lock, generousLimit, [&] { return requests >= count; }));
  lock.unlock();
  EXPECT_TRUE(isServing());
  lock.lock();
  return --requests;
}

bool ConduitTest::isServing() {
  RawClient client(socketPath());
  client.sendRequest(7, "still there?");
  return client.receiveReply(7) == PropertyListValue("still there?");
}

}  // namespace kel::platform
