#pragma once

#include <condition_variable>
#include <gtest/gtest.h>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/conduit.h"

namespace kel::test {

/// A server that does what a request's string says: "hold" keeps the message, "drop" lets go of it, "big"
/// answers with 10 MB, anything else is echoed. Every client must be the process `peer`.
class EchoingServer {
 public:
  explicit EchoingServer(std::int64_t peer) : peer_(peer) {}
  ~EchoingServer() { stop(); }

  void serve(platform::Conduit& conduit, std::string_view name) {
    auto listening = conduit.listen(name, queue, [this](const auto& event) { handle(event); });
    EXPECT_EQ(listening.error, "");
    listener = std::move(listening.listener);
  }
  void stop() {
    queue.sync([&] { listener.reset(); });
  }

  /// Waits, within a generous limit, until that many requests and errors have arrived.
  bool await(std::size_t requestCount, std::size_t errorCount = 0) {
    std::unique_lock lock(mutex);
    return changed.wait_for(lock, std::chrono::seconds(30),
                            [&] { return requests >= requestCount && errors.size() >= errorCount; });
  }

  const platform::PropertyListValue big{platform::Bytes(10'000'000, 'b')};

  std::mutex mutex;
  std::condition_variable changed;
  std::size_t requests = 0;                                     // under mutex
  std::vector<std::shared_ptr<platform::ConduitMessage>> held;  // under mutex
  std::vector<std::string> errors;                              // under mutex

  platform::SerialQueue queue{"KEL Conduit Server"};
  std::unique_ptr<platform::ConduitListener> listener;

 private:
  void handle(const platform::ConduitEvent& event) {
    EXPECT_TRUE(queue.isCurrent());
    if (const auto* connection = std::get_if<std::shared_ptr<platform::ConduitConnection>>(&event)) {
      EXPECT_EQ((*connection)->peer()->processID(), peer_);
      (*connection)->setEventHandler([this](const auto& inner) { handle(inner); });
      return (*connection)->start();
    }
    const std::lock_guard lock(mutex);
    if (const auto* error = std::get_if<platform::ConduitError>(&event)) {
      errors.push_back(error->description);
    } else {
      perform(std::get<std::shared_ptr<platform::ConduitMessage>>(event));
    }
    changed.notify_all();
  }

  void perform(const std::shared_ptr<platform::ConduitMessage>& message) {
    const platform::PropertyListValue contents = message->contents();
    ++requests;
    if (contents == "hold") {
      held.push_back(message);
    } else if (contents != "drop") {
      message->discardContents();
      EXPECT_TRUE(message->contents() == platform::PropertyListDictionary() && message->canReply());
      message->reply(contents == "big" ? big : contents);
      EXPECT_FALSE(message->canReply());
    }
  }

  const std::int64_t peer_;
};

/// A client that sends its requests over one connection.
class SendingClient {
 public:
  SendingClient(platform::Conduit& conduit, std::string_view name)
      : connection_(conduit.connect(name, queue_)) {
    connection_->setEventHandler([this](const platform::ConduitEvent& event) {
      EXPECT_TRUE(queue_.isCurrent());
      events_.push_back(std::get<platform::ConduitError>(event).description);
    });
    connection_->start();
  }

  /// The reply, or the error's description.
  platform::PropertyListValue send(const platform::PropertyListValue& contents) {
    const platform::ConduitReply reply = connection_->sendAndWait(contents);
    const auto* error = std::get_if<platform::ConduitError>(&reply);
    return error ? error->description : std::get<platform::PropertyListValue>(reply);
  }

  /// The errors that came as events so far.
  std::vector<std::string> events() {
    queue_.sync([] {});
    return events_;
  }

 private:
  std::vector<std::string> events_;
  platform::SerialQueue queue_{"kel contact queue"};
  std::shared_ptr<platform::ConduitConnection> connection_;
};

}  // namespace kel::test
