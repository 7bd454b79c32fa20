#pragma once

#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/platform.h"
#include "simulation/scheduler.h"
#include "support/in_memory_bundles.h"
#include "support/in_memory_conduit.h"
#include "support/in_memory_directories.h"
#include "support/in_memory_files.h"
#include "support/in_memory_services.h"
#include "support/property_lists.h"

namespace kel::simulation {

using test::Dictionary;
using test::Value;

/// The disk: every operation of a server lets others go first, some fail. What was written stays.
class Disk : public test::InMemoryFileSystem {
 public:
  platform::DirectoryReading listDirectory(const std::string& directory) override {
    Scheduler::current().yield();
    if (failsReads && Scheduler::current().oneIn(4))
      return {std::nullopt, directory + ": no descriptor left", true};
    return InMemoryFileSystem::listDirectory(directory);
  }
  platform::FileReading read(const std::string& path, std::size_t largest) override {
    Scheduler::current().yield();
    if (failsReads && Scheduler::current().oneIn(4))
      return {std::nullopt, path + ": Input/output error", true};
    return InMemoryFileSystem::read(path, largest);
  }
  std::optional<std::string> writeAtomically(const std::string& path, platform::BytesView bytes) override {
    Scheduler::current().yield();
    if (failsWrites && Scheduler::current().oneIn(4)) failNextWrite("no space");
    return InMemoryFileSystem::writeAtomically(path, bytes);
  }
  bool remove(const std::string& path) override {
    Scheduler::current().yield();
    return InMemoryFileSystem::remove(path);
  }

  bool failsWrites = false;
  bool failsReads = false;
};

/// Seeds that never go back, whoever ends when.
class Seeds : public test::InMemorySeeds {
 public:
  void setState(Token token, std::uint64_t state) override {
    Scheduler::current().yield();
    if (static_cast<std::int64_t>(state - this->state(token)) < 0 && this->state(token) != 0) {
      throw std::logic_error("the seed went back");
    }
    InMemorySeeds::setState(token, state);
    Scheduler::current().yield();
  }
};

/// The journal of the disk: it knows every change as soon as it was made, and at times says less than it
/// knows.
class Journal : public test::InMemoryJournal {
 public:
  std::unique_ptr<platform::JournalStream> createStream(platform::JournalCallback callback,
                                                        const std::vector<std::string>& paths,
                                                        platform::EventID since,
                                                        std::chrono::nanoseconds latency,
                                                        std::uint32_t flags) override {
    if (Scheduler::current().oneIn(16)) record(paths.front(), platform::event_flags::mustScanSubDirectories);
    if (Scheduler::current().oneIn(16)) record(paths.front());
    return InMemoryJournal::createStream(std::move(callback), paths, since, latency, flags);
  }
};

/// The endpoint. A request reaches the server as over a connection of its own.
class Endpoint : public platform::Conduit {
 public:
  void trackActivity() override {}
  platform::ConduitListening listen(std::string_view, platform::SerialQueue& queue,
                                    platform::ConduitEventHandler handler) override {
    server_.emplace(Server{queue, std::move(handler)});
    return {std::make_unique<Listener>(*this), false, {}};
  }
  std::shared_ptr<platform::ConduitConnection> connect(std::string_view, platform::SerialQueue&) override {
    throw std::logic_error("clients ask");
  }

  /// Sends a request and waits for what comes of it. Without a server, at once an error.
  platform::ConduitReply ask(const Value& contents) {
    using platform::ConduitError;
    if (!server_) return ConduitError{ConduitError::Kind::ConnectionInvalid, "Connection invalid"};
    auto answer = std::make_shared<test::InMemoryMessage::Answer>();
    const auto connection = std::make_shared<Connection>();
    server_->queue.async([handler = server_->handler, connection] { handler(connection); });
    server_->queue.async([connection, message = std::make_shared<test::InMemoryMessage>(
                                          contents, true, answer)] { connection->handler(message); });
    return answer->wait();
  }

 private:
  struct Server {
    platform::SerialQueue& queue;
    platform::ConduitEventHandler handler;
  };
  struct Listener : platform::ConduitListener {
    explicit Listener(Endpoint& listening) : endpoint(listening) {}
    ~Listener() override { endpoint.server_.reset(); }
    Endpoint& endpoint;
  };
  struct Connection : platform::ConduitConnection {
    std::shared_ptr<const platform::PeerProcess> peer() const override { return nullptr; }
    void setEventHandler(platform::ConduitEventHandler events) override { handler = std::move(events); }
    void start() override {}
    platform::ConduitReply sendAndWait(const Value&) override { throw std::logic_error("the server's end"); }
    platform::ConduitEventHandler handler;
  };

  std::optional<Server> server_;
};

/// Streams that fire once at the start and when the world says so, as long as the server that listens lives.
class LaunchEvents : public platform::LaunchEvents {
 public:
  void setHandler(std::string_view stream, platform::SerialQueue& queue,
                  std::function<void()> handler) override {
    queue.async(handler);
    handlers_[std::string(stream)] = [&queue, handler = std::move(handler)] { queue.async(handler); };
  }
  void fire(const std::string& stream) {
    if (const auto found = handlers_.find(stream); found != handlers_.end()) found->second();
  }
  void forgetHandlers() { handlers_.clear(); }

 private:
  std::map<std::string, std::function<void()>> handlers_;
};

class VirtualClock : public platform::Clock {
 public:
  double wallClockSeconds() const override {
    return wallClockOffset + std::chrono::duration<double>(Scheduler::current().now()).count();
  }
  void after(platform::SerialQueue& queue, std::chrono::nanoseconds delay, platform::Task task) override {
    queue.after(delay, std::move(task));
  }
  bool wait(platform::Semaphore& semaphore, std::chrono::nanoseconds timeout) override {
    return semaphore.wait(timeout);
  }

  double wallClockOffset = 1'000'000;
};

/// What outlasts a server: the disk and what is known of it, and who asks.
struct World {
  VirtualClock clock;
  Disk files;
  test::InMemoryDirectories directories;
  test::InMemoryBundles bundles{files};
  test::InMemoryFacts facts;
  test::RecordingLog log;
  test::CountingTransactions transactions;
  Endpoint conduit;
  test::InMemorySandbox sandbox;
  LaunchEvents launchEvents;
  Seeds seeds;
  test::InMemoryPublication publication;
  test::InMemoryRegistry registry;
  Journal journal;
};

}  // namespace kel::simulation
