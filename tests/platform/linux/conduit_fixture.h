#pragma once

#include <condition_variable>
#include <filesystem>
#include <gmock/gmock.h>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/guarded.h"
#include "platform/linux/linux_conduit.h"
#include "platform/linux/owned_descriptor.h"
#include "support/manual_clock.h"
#include "support/print.h"

namespace kel::platform {

inline constexpr const char* endpointName = "com.orvex.kel.fetch_services";

class RecordingLog : public SystemLog {
 public:
  void write(std::string_view message) override {
    lines_.with([&](auto& lines) { lines.emplace_back(message); });
  }
  std::vector<std::string> lines() const { return lines_.copy(); }

 private:
  Guarded<std::vector<std::string>> lines_;
};

class ScratchDirectory {
 public:
  ScratchDirectory();
  ~ScratchDirectory() { std::filesystem::remove_all(path_); }
  const std::string& path() const { return path_; }

 private:
  std::string path_;
};

/// A client that speaks bytes. Every wait has a generous limit, after which it counts as failed.
class RawClient {
 public:
  explicit RawClient(const std::string& socketPath);
  explicit RawClient(OwnedDescriptor connected);

  void send(BytesView bytes);
  void sendRequest(std::uint64_t tag, const PropertyListValue& contents);
  void sendWithDescriptor(BytesView bytes, int descriptor);

  /// Up to `count` bytes, fewer when the server closed the connection first.
  Bytes receive(std::size_t count);
  bool isClosedByServer();

  /// The next reply's contents, checked to carry `tag`; absent for a dropped frame.
  std::optional<PropertyListValue> receiveReply(std::uint64_t tag);

 private:
  OwnedDescriptor socket_;
};

Bytes requestFrame(std::uint64_t tag, const PropertyListValue& contents);
Bytes rawFrame(std::uint32_t length, std::uint32_t kind, std::uint64_t tag, std::string_view payload);

/// A server in a scratch directory that does what a request's string says: "hold" keeps the message, "drop"
/// lets go of it, "big" answers with 10 MB, "elsewhere..." is echoed from another thread, anything else at
/// once.
class ConduitTest : public testing::Test {
 protected:
  ~ConduitTest() override { stopServer(); }

  /// Serves the endpoint, with the sockets that a launcher `passed`.
  void startServer(LauncherSockets passed = {});
  void stopServer();
  std::string socketPath() const { return directory.path() + "/" + endpointName; }
  LinuxConduit makeConduit(LauncherSockets passed);

  /// Waits until `count` requests have arrived; then whatever else the server would take it has taken.
  std::size_t awaitRequests(std::size_t count);

  /// True when a new client is served.
  bool isServing();

  ScratchDirectory directory;
  RecordingLog log;
  test::ManualClock clock;
  const PropertyListValue big{Bytes(10'000'000, 'b')};

  std::mutex mutex;
  std::condition_variable changed;
  std::size_t requests = 0;                           // under mutex
  std::vector<std::shared_ptr<ConduitMessage>> held;  // under mutex
  std::vector<std::string> errors;                    // under mutex
  std::vector<std::int64_t> peers;                    // under mutex

  SerialQueue otherQueue{"other"};
  SerialQueue queue{"KEL Conduit Server"};
  LinuxConduit conduit = makeConduit({});
  std::unique_ptr<ConduitListener> listener;

 private:
  void handle(const ConduitEvent& event);
  void perform(const std::shared_ptr<ConduitMessage>& message);

  bool handling = false;  // on queue
};

}  // namespace kel::platform
