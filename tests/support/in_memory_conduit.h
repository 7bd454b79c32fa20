#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

#include "platform/conduit.h"
#include "platform/guarded.h"
#include "platform/sandbox_query.h"

namespace kel::test {

inline const platform::ConduitError connectionInvalid{platform::ConduitError::Kind::ConnectionInvalid,
                                                      "Connection invalid"};
inline const platform::ConduitError connectionInterrupted{platform::ConduitError::Kind::ConnectionInterrupted,
                                                          "Connection interrupted"};

/// A request made by hand. Its reply, or the error of a dropped request, can be waited for.
class InMemoryMessage : public platform::ConduitMessage {
 public:
  /// What became of the request; shared with the test.
  struct Answer {
    platform::Semaphore arrived;
    platform::Guarded<std::optional<platform::ConduitReply>> reply;

    /// What comes first counts.
    void set(platform::ConduitReply value) {
      reply.with([&](auto& known) {
        if (!known) known = std::move(value);
      });
      arrived.signal();
    }
    /// Waits, within a generous limit.
    platform::ConduitReply wait() {
      if (!isThere() && !arrived.wait(std::chrono::seconds(60))) throw std::runtime_error("no reply came");
      return *reply.copy();
    }
    bool isThere() const { return reply.copy().has_value(); }
  };

  InMemoryMessage(platform::PropertyListValue contents, bool wantsReply, std::shared_ptr<Answer> answer)
      : contents_(std::move(contents)), wantsReply_(wantsReply), answer_(std::move(answer)) {}
  ~InMemoryMessage() override {
    if (wantsReply_) answer_->set(connectionInterrupted);
  }
  const platform::PropertyListValue& contents() const override { return contents_; }
  void discardContents() override { contents_ = platform::PropertyListDictionary(); }
  bool canReply() const override { return wantsReply_; }
  void reply(const platform::PropertyListValue& contents) override {
    if (!wantsReply_.exchange(false)) throw std::logic_error("a second reply, or one nobody waits for");
    answer_->set(contents);
  }

 private:
  platform::PropertyListValue contents_;
  std::atomic<bool> wantsReply_;
  const std::shared_ptr<Answer> answer_;
};

/// Endpoints within the process: a connection's messages reach the listener on the listener's queue. Nothing
/// may be sent between the end of that queue and that of the listener.
class InMemoryConduit : public platform::Conduit {
 public:
  void trackActivity() override {}
  platform::ConduitListening listen(std::string_view name, platform::SerialQueue& queue,
                                    platform::ConduitEventHandler handler) override {
    return endpoints_.with([&](auto& endpoints) -> platform::ConduitListening {
      std::shared_ptr<Endpoint>& endpoint = endpoints[std::string(name)];
      if (endpoint && endpoint->queue.copy()) return {nullptr, true, "another server holds the endpoint"};
      endpoint = std::make_shared<Endpoint>(queue, std::move(handler));
      return {std::make_unique<Listener>(endpoint), false, {}};
    });
  }
  std::shared_ptr<platform::ConduitConnection> connect(std::string_view name,
                                                       platform::SerialQueue& queue) override {
    ++connections;
    return std::make_shared<ClientConnection>(endpoints_.copy()[std::string(name)], queue, nextPeer);
  }

  /// Delivers any event to the only listener.
  void deliver(const platform::ConduitEvent& event) {
    const std::shared_ptr<Endpoint> endpoint = endpoints_.copy().begin()->second;
    endpoint->queue.copy()->sync([&] { endpoint->handler(event); });
  }

  std::int64_t nextPeer = 4711;  ///< process id of the next connection's peer
  std::atomic<int> connections = 0;

 private:
  using Answer = InMemoryMessage::Answer;

  struct Endpoint : std::enable_shared_from_this<Endpoint> {
    Endpoint(platform::SerialQueue& listening, platform::ConduitEventHandler handle)
        : handler(std::move(handle)), queue(&listening) {}

    /// Runs `task` on the queue unless the listener goes first; false when it has gone.
    bool async(platform::Task task) {
      return queue.with([&](platform::SerialQueue* open) {
        if (!open) return false;
        open->async([self = shared_from_this(), task = std::move(task)] {
          if (self->queue.copy()) task();
        });
        return true;
      });
    }

    const platform::ConduitEventHandler handler;
    platform::Guarded<platform::SerialQueue*> queue;  ///< null when the listener has gone
    std::vector<std::weak_ptr<Answer>> awaited;       ///< only on the queue
  };

  struct Listener : platform::ConduitListener {
    explicit Listener(std::shared_ptr<Endpoint> listening) : endpoint(std::move(listening)) {}
    ~Listener() override {
      endpoint->queue.set(nullptr);
      for (const auto& awaited : endpoint->awaited) {
        if (const auto answer = awaited.lock()) answer->set(connectionInterrupted);
      }
    }
    const std::shared_ptr<Endpoint> endpoint;
  };

  struct Peer : platform::PeerProcess {
    explicit Peer(std::int64_t processID) : id(processID) {}
    std::int64_t processID() const override { return id; }
    const std::int64_t id;
  };

  /// The server's end, on the listener's queue.
  struct ServerConnection : platform::ConduitConnection {
    explicit ServerConnection(std::int64_t processID) : process(std::make_shared<Peer>(processID)) {}
    std::shared_ptr<const platform::PeerProcess> peer() const override { return process; }
    void setEventHandler(platform::ConduitEventHandler handle) override { handler = std::move(handle); }
    void start() override { isStarted = true; }
    platform::ConduitReply sendAndWait(const platform::PropertyListValue&) override {
      return connectionInvalid;
    }
    void deliver(const platform::ConduitEvent& event) {
      if (!isStarted) throw std::logic_error("an event for a connection that was not started");
      handler(event);
    }
    const std::shared_ptr<const Peer> process;
    platform::ConduitEventHandler handler;
    bool isStarted = false;
  };

  /// The client's end; the first error also goes to its handler. One thread at a time.
  class ClientConnection : public platform::ConduitConnection {
   public:
    ClientConnection(std::shared_ptr<Endpoint> endpoint, platform::SerialQueue& queue, std::int64_t processID)
        : endpoint_(std::move(endpoint)),
          queue_(queue),
          far_(std::make_shared<ServerConnection>(processID)) {}
    ~ClientConnection() override {
      if (isConnected_) endpoint_->async([far = far_] { far->deliver(connectionInvalid); });
    }
    std::shared_ptr<const platform::PeerProcess> peer() const override { return nullptr; }
    void setEventHandler(platform::ConduitEventHandler handler) override { handler_ = std::move(handler); }
    void start() override {
      isConnected_ = endpoint_ && endpoint_->async([to = endpoint_.get(), far = far_] { to->handler(far); });
      if (!isConnected_) fail(connectionInvalid);
    }
    platform::ConduitReply sendAndWait(const platform::PropertyListValue& contents) override {
      const auto answer = std::make_shared<Answer>();
      auto message = std::make_shared<InMemoryMessage>(contents, true, answer);
      auto task = [to = endpoint_.get(), far = far_, answer, message = std::move(message)] {
        to->awaited.push_back(answer);
        far->deliver(message);
      };
      if (!isConnected_ || !endpoint_->async(std::move(task))) return fail(connectionInvalid);
      const platform::ConduitReply reply = answer->wait();
      const auto* error = std::get_if<platform::ConduitError>(&reply);
      return error ? fail(*error) : reply;
    }

   private:
    platform::ConduitReply fail(const platform::ConduitError& error) {
      const auto handler = std::exchange(handler_, nullptr);
      if (handler) queue_.async([handler, error] { handler(error); });
      return error;
    }

    const std::shared_ptr<Endpoint> endpoint_;  ///< null when none was served
    platform::SerialQueue& queue_;
    const std::shared_ptr<ServerConnection> far_;
    platform::ConduitEventHandler handler_;
    bool isConnected_ = false;
  };

  platform::Guarded<std::map<std::string, std::shared_ptr<Endpoint>>> endpoints_;
};

/// Answers by process id; a process of no answer is not sandboxed.
class InMemorySandbox : public platform::SandboxQuery {
 public:
  int check(const platform::PeerProcess& process) override { return answers[process.processID()]; }
  std::map<std::int64_t, int> answers;
};

}  // namespace kel::test
