#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string_view>
#include <utility>
#include <variant>

#include "platform/conduit.h"
#include "platform/guarded.h"
#include "platform/sandbox_query.h"

namespace kel::test {

/// A request made by hand. Its reply, or the error of a dropped request, can be waited for.
class InMemoryMessage : public platform::ConduitMessage {
 public:
  /// What became of the request; shared with the test.
  struct Answer {
    platform::Semaphore arrived;
    platform::Guarded<std::optional<platform::ConduitReply>> reply;

    void set(platform::ConduitReply value) {
      reply.set(std::move(value));
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
    using platform::ConduitError;
    if (wantsReply_)
      answer_->set(ConduitError{ConduitError::Kind::ConnectionInterrupted, "Connection interrupted"});
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

/// Endpoints within the process: a connection's messages reach the listener on the listener's queue.
class InMemoryConduit : public platform::Conduit {
 public:
  void trackActivity() override {}
  platform::ConduitListening listen(std::string_view, platform::SerialQueue& queue,
                                    platform::ConduitEventHandler handler) override {
    endpoint_.set(std::make_shared<Endpoint>(Endpoint{queue, std::move(handler)}));
    return {std::make_unique<Listener>(*this), false, {}};
  }
  std::shared_ptr<platform::ConduitConnection> connect(std::string_view, platform::SerialQueue&) override {
    ++connections;
    return std::make_shared<Connection>(endpoint_.copy(), nextPeer);
  }

  /// Delivers any event to the listener.
  void deliver(const platform::ConduitEvent& event) {
    const std::shared_ptr<Endpoint> endpoint = endpoint_.copy();
    endpoint->queue.sync([&] { endpoint->handler(event); });
  }

  std::int64_t nextPeer = 4711;  ///< process id of the next connection's peer
  std::atomic<int> connections = 0;

 private:
  struct Endpoint {
    platform::SerialQueue& queue;
    platform::ConduitEventHandler handler;
  };

  struct Listener : platform::ConduitListener {
    explicit Listener(InMemoryConduit& listening) : conduit(listening) {}
    ~Listener() override { conduit.endpoint_.set(nullptr); }
    InMemoryConduit& conduit;
  };

  struct Peer : platform::PeerProcess {
    explicit Peer(std::int64_t processID) : id(processID) {}
    std::int64_t processID() const override { return id; }
    const std::int64_t id;
  };

  /// Either end of a connection; that of the server, on the listener's queue, is the client's far end.
  class Connection : public platform::ConduitConnection {
   public:
    explicit Connection(std::int64_t processID) : peer_(std::make_shared<Peer>(processID)) {}
    Connection(std::shared_ptr<Endpoint> endpoint, std::int64_t processID)
        : endpoint_(std::move(endpoint)), far_(std::make_shared<Connection>(processID)) {}
    ~Connection() override {
      if (endpoint_) endpoint_->queue.async([far = far_] { far->handler_(invalid()); });
    }
    std::shared_ptr<const platform::PeerProcess> peer() const override { return peer_; }
    void setEventHandler(platform::ConduitEventHandler handler) override { handler_ = std::move(handler); }
    void start() override {
      started_ = true;
      if (endpoint_) endpoint_->queue.async([to = endpoint_, far = far_] { to->handler(far); });
    }
    platform::ConduitReply sendAndWait(const platform::PropertyListValue& contents) override {
      if (!endpoint_) return invalid();
      auto answer = std::make_shared<InMemoryMessage::Answer>();
      auto message = std::make_shared<InMemoryMessage>(contents, true, answer);
      endpoint_->queue.async([far = far_, message = std::move(message)] {
        if (!far->started_) throw std::logic_error("a message for a connection that was not started");
        far->handler_(message);
      });
      return answer->wait();
    }

   private:
    static platform::ConduitError invalid() {
      return {platform::ConduitError::Kind::ConnectionInvalid, "Connection invalid"};
    }

    const std::shared_ptr<Endpoint> endpoint_;  ///< the client's end only, and only when a server listens
    const std::shared_ptr<Connection> far_;
    const std::shared_ptr<const Peer> peer_;
    platform::ConduitEventHandler handler_;
    bool started_ = false;
  };

  platform::Guarded<std::shared_ptr<Endpoint>> endpoint_;
};

/// Answers by process id; a process of no answer is not sandboxed.
class InMemorySandbox : public platform::SandboxQuery {
 public:
  int check(const platform::PeerProcess& process) override { return answers[process.processID()]; }
  std::map<std::int64_t, int> answers;
};

}  // namespace kel::test
