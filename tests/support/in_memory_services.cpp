#include "support/in_memory_services.h"

#include <algorithm>
#include <stdexcept>

namespace kel::test {

using platform::ConduitError;
using platform::ConduitEvent;
using platform::ConduitReply;
using platform::PropertyListValue;

namespace {
constexpr auto generousLimit = std::chrono::seconds(60);
}

std::uint32_t InMemoryFacts::random32() {
  if (randomNumbers.empty()) return 7;
  const std::uint32_t number = randomNumbers.front();
  randomNumbers.pop_front();
  return number;
}

std::optional<std::string> InMemoryFacts::environmentVariable(const std::string& name) {
  const auto found = environment.find(name);
  return found == environment.end() ? std::nullopt : std::optional(found->second);
}

void CountingTransactions::open() { ++open_; }

void CountingTransactions::close() {
  if (open_-- <= 0) throw std::logic_error("closed more transactions than were opened");
}

InMemorySeeds::Token InMemorySeeds::registerName(const std::string& name) {
  return seeds_.with([&](std::vector<Seed>& seeds) {
    const auto found =
        std::find_if(seeds.begin(), seeds.end(), [&](const Seed& seed) { return seed.name == name; });
    const auto index = found - seeds.begin();
    if (found == seeds.end()) seeds.push_back({name, 0, 0});
    return static_cast<Token>(index);
  });
}

std::uint64_t InMemorySeeds::state(Token token) {
  return seeds_.with([&](const auto& seeds) { return seeds.at(static_cast<std::size_t>(token)).state; });
}

void InMemorySeeds::setState(Token token, std::uint64_t state) {
  seeds_.with([&](auto& seeds) { seeds.at(static_cast<std::size_t>(token)).state = state; });
}

void InMemorySeeds::post(const std::string& name) {
  const Token token = registerName(name);
  seeds_.with([&](auto& seeds) { ++seeds.at(static_cast<std::size_t>(token)).posts; });
}

std::unique_ptr<platform::NotificationSeeds::Observation> InMemorySeeds::observe(const std::string&,
                                                                                 platform::SerialQueue&,
                                                                                 std::function<void()>) {
  return nullptr;
}

std::size_t InMemorySeeds::postsOf(const std::string& name) {
  const Token token = registerName(name);
  return seeds_.with([&](const auto& seeds) { return seeds.at(static_cast<std::size_t>(token)).posts; });
}

void InMemoryLaunchEvents::setHandler(std::string_view stream, platform::SerialQueue& queue,
                                      std::function<void()> handler) {
  order_.emplace_back(stream);
  handlers_[std::string(stream)] = {&queue, std::move(handler)};
}

void InMemoryLaunchEvents::fire(const std::string& stream) {
  auto& [queue, handler] = handlers_.at(stream);
  queue->async(handler);
}

std::vector<platform::RegisteredApplication> InMemoryRegistry::applications(std::uint32_t mask,
                                                                            std::uint32_t value) {
  ++queries;
  std::vector<platform::RegisteredApplication> result;
  for (const auto& [application, flags] : registered) {
    if ((flags & mask) == value) result.push_back(application);
  }
  return result;
}

class InMemoryStream : public platform::JournalStream {
 public:
  InMemoryStream(InMemoryJournal& journal, platform::JournalCallback callback, std::vector<std::string> paths,
                 platform::EventID since)
      : journal_(journal), callback_(std::move(callback)), paths_(std::move(paths)), since_(since) {
    ++journal_.liveStreams;
  }
  ~InMemoryStream() override { --journal_.liveStreams; }

  void setQueue(platform::SerialQueue& queue) override { queue_ = &queue; }

  bool start() override {
    if (journal_.refuseStart) return false;
    std::vector<platform::JournalEvent> batch;
    for (const platform::JournalEvent& event : journal_.events_) {
      const bool watched = std::any_of(paths_.begin(), paths_.end(), [&](const std::string& path) {
        return event.path.starts_with(path) || path.starts_with(event.path);
      });
      if (event.eventID > since_ && watched) batch.push_back(event);
    }
    if (journal_.historyEnds) batch.push_back({"", platform::event_flags::historyDone, journal_.newest_});
    queue_->async([callback = callback_, batch] { callback(batch); });
    if (!journal_.afterHistory.empty()) {
      queue_->async([callback = callback_, later = journal_.afterHistory] { callback(later); });
    }
    return true;
  }

  void stop() override {}
  void invalidate() override {}

 private:
  InMemoryJournal& journal_;
  platform::JournalCallback callback_;
  std::vector<std::string> paths_;
  platform::EventID since_;
  platform::SerialQueue* queue_ = nullptr;
};

std::unique_ptr<platform::JournalStream> InMemoryJournal::createStream(platform::JournalCallback callback,
                                                                       const std::vector<std::string>& paths,
                                                                       platform::EventID since,
                                                                       std::chrono::nanoseconds,
                                                                       std::uint32_t flags) {
  creations.push_back({paths, since, flags});
  if (!available || (refuseWatchRoot && (flags & platform::stream_flags::watchRoot))) return nullptr;
  return std::make_unique<InMemoryStream>(*this, std::move(callback), paths, since);
}

void InMemoryJournal::record(const std::string& path, std::uint32_t flags) {
  events_.push_back({path, flags, ++newest_});
}

void InMemoryMessage::Answer::set(ConduitReply value) {
  reply.set(std::move(value));
  arrived.signal();
}

ConduitReply InMemoryMessage::Answer::wait() {
  if (!isThere() && !arrived.wait(generousLimit)) throw std::runtime_error("no reply within the limit");
  return *reply.copy();
}

InMemoryMessage::~InMemoryMessage() {
  if (wantsReply_) {
    answer_->set(ConduitError{ConduitError::Kind::ConnectionInterrupted, "Connection interrupted"});
  }
}

void InMemoryMessage::reply(const PropertyListValue& contents) {
  if (!wantsReply_.exchange(false)) throw std::logic_error("a second reply, or one nobody waits for");
  answer_->set(contents);
}

namespace {

class InMemoryPeer : public platform::PeerProcess {
 public:
  explicit InMemoryPeer(std::int64_t processID) : processID_(processID) {}
  std::int64_t processID() const override { return processID_; }

 private:
  const std::int64_t processID_;
};

/// The server's end of a connection; on the listener's queue.
class InMemoryAcceptedConnection : public platform::ConduitConnection {
 public:
  explicit InMemoryAcceptedConnection(std::int64_t processID)
      : peer_(std::make_shared<InMemoryPeer>(processID)) {}
  std::shared_ptr<const platform::PeerProcess> peer() const override { return peer_; }
  void setEventHandler(platform::ConduitEventHandler handler) override { handler_ = std::move(handler); }
  void start() override { started_ = true; }
  ConduitReply sendAndWait(const PropertyListValue&) override {
    throw std::logic_error("the server's end sends no requests");
  }

  void deliver(const ConduitEvent& event) const {
    if (!started_ || !handler_) throw std::logic_error("an event for a connection that was not started");
    handler_(event);
  }

 private:
  const std::shared_ptr<InMemoryPeer> peer_;
  platform::ConduitEventHandler handler_;
  bool started_ = false;
};

const ConduitError connectionInvalid{ConduitError::Kind::ConnectionInvalid, "Connection invalid"};

}  // namespace

class InMemoryListener : public platform::ConduitListener {
 public:
  explicit InMemoryListener(InMemoryConduit& conduit) : conduit_(conduit) {}
  ~InMemoryListener() override { conduit_.endpoint_.set(nullptr); }

 private:
  InMemoryConduit& conduit_;
};

class InMemoryClientConnection : public platform::ConduitConnection {
 public:
  InMemoryClientConnection(std::shared_ptr<InMemoryConduit::Endpoint> endpoint, std::int64_t processID)
      : endpoint_(std::move(endpoint)), accepted_(std::make_shared<InMemoryAcceptedConnection>(processID)) {}
  ~InMemoryClientConnection() override {
    if (!endpoint_ || !started_) return;
    endpoint_->queue->async([accepted = accepted_] { accepted->deliver(connectionInvalid); });
  }

  std::shared_ptr<const platform::PeerProcess> peer() const override { return nullptr; }
  void setEventHandler(platform::ConduitEventHandler handler) override { handler_ = std::move(handler); }

  void start() override {
    started_ = true;
    if (!endpoint_) return;
    endpoint_->queue->async([endpoint = endpoint_, accepted = accepted_] {
      endpoint->handler(std::static_pointer_cast<platform::ConduitConnection>(accepted));
    });
  }

  ConduitReply sendAndWait(const PropertyListValue& contents) override {
    if (!endpoint_) return connectionInvalid;
    auto answer = std::make_shared<InMemoryMessage::Answer>();
    endpoint_->queue->async(
        [accepted = accepted_, message = std::make_shared<InMemoryMessage>(contents, true, answer)] {
          accepted->deliver(std::static_pointer_cast<platform::ConduitMessage>(message));
        });
    return answer->wait();
  }

 private:
  const std::shared_ptr<InMemoryConduit::Endpoint> endpoint_;
  const std::shared_ptr<InMemoryAcceptedConnection> accepted_;
  platform::ConduitEventHandler handler_;
  bool started_ = false;
};

platform::ConduitListening InMemoryConduit::listen(std::string_view, platform::SerialQueue& queue,
                                                   platform::ConduitEventHandler handler) {
  if (endpoint_.copy()) return {nullptr, true, "another server holds the endpoint"};
  endpoint_.set(std::make_shared<Endpoint>(Endpoint{&queue, std::move(handler)}));
  return {std::make_unique<InMemoryListener>(*this), false, {}};
}

std::shared_ptr<platform::ConduitConnection> InMemoryConduit::connect(std::string_view,
                                                                      platform::SerialQueue&) {
  ++connections;
  return std::make_shared<InMemoryClientConnection>(endpoint_.copy(), nextPeer);
}

void InMemoryConduit::deliver(const ConduitEvent& event) {
  const std::shared_ptr<Endpoint> endpoint = endpoint_.copy();
  endpoint->queue->sync([&] { endpoint->handler(event); });
}

int InMemorySandbox::check(const platform::PeerProcess& process) {
  const auto holds = [&process](const std::vector<std::int64_t>& ids) {
    return std::find(ids.begin(), ids.end(), process.processID()) != ids.end();
  };
  return holds(failing) ? -1 : holds(sandboxed) ? 1 : 0;
}

}  // namespace kel::test
