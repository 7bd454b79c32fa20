#pragma once

#include <atomic>
#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/platform.h"

namespace kel::test {

/// Facts that a test sets; random numbers come from a list, then count upwards.
class InMemoryFacts : public platform::SystemFacts {
 public:
  std::string buildVersion() override { return version; }
  platform::SystemReading bootTime() override { return boot; }
  platform::SystemReading auditSession() override { return session; }
  std::uint32_t realUserID() override { return 501; }
  std::uint32_t random32() override;
  std::optional<std::string> environmentVariable(const std::string& name) override;

  std::string version = "linux 1";
  platform::SystemReading boot{1700000000, 0, {}};
  platform::SystemReading session{100004, 0, {}};
  std::deque<std::uint32_t> randomNumbers;
  std::map<std::string, std::string> environment;
};

class CountingTransactions : public platform::Transactions {
 public:
  void open() override;
  void close() override;
  std::int64_t openCount() const { return open_; }

 private:
  std::atomic<std::int64_t> open_ = 0;
};

/// Seeds in memory; posts are told to observers and counted. Any thread.
class InMemorySeeds : public platform::NotificationSeeds {
 public:
  Token registerName(const std::string& name) override;
  std::uint64_t state(Token token) override;
  void setState(Token token, std::uint64_t state) override;
  void post(const std::string& name) override;
  std::unique_ptr<Observation> observe(const std::string& name, platform::SerialQueue& queue,
                                       std::function<void()> posted) override;

  std::uint64_t stateOf(const std::string& name) { return state(registerName(name)); }
  void setStateOf(const std::string& name, std::uint64_t state) { setState(registerName(name), state); }
  std::size_t postsOf(const std::string& name);

 private:
  struct Seed {
    std::string name;
    std::uint64_t state = 0;
    std::size_t posts = 0;
  };
  platform::Guarded<std::vector<Seed>> seeds_;
};

/// Streams that a test fires; the event at the start is left to the test.
class InMemoryLaunchEvents : public platform::LaunchEvents {
 public:
  void setHandler(std::string_view stream, platform::SerialQueue& queue,
                  std::function<void()> handler) override;

  /// Queues the stream's handler.
  void fire(const std::string& stream);
  std::vector<std::string> streams() const { return order_; }

 private:
  std::vector<std::string> order_;
  std::map<std::string, std::pair<platform::SerialQueue*, std::function<void()>>> handlers_;
};

class InMemoryRegistry : public platform::ApplicationRegistry {
 public:
  std::vector<platform::RegisteredApplication> applications(std::uint32_t mask, std::uint32_t value) override;

  std::vector<std::pair<platform::RegisteredApplication, std::uint32_t>>
      registered;  ///< with information flags
  std::atomic<std::size_t> queries = 0;

  void add(const std::string& path) { registered.push_back({{path}, providesServices}); }
};

/// A journal in memory: replays what was recorded, and misbehaves on demand. One test thread arranges it.
class InMemoryJournal : public platform::EventJournal {
 public:
  platform::EventID currentEventID() override { return newest_; }
  std::unique_ptr<platform::JournalStream> createStream(platform::JournalCallback callback,
                                                        const std::vector<std::string>& paths,
                                                        platform::EventID since,
                                                        std::chrono::nanoseconds latency,
                                                        std::uint32_t flags) override;

  /// Records an event at the next position.
  void record(const std::string& path, std::uint32_t flags = 0);

  struct Creation {
    std::vector<std::string> paths;
    platform::EventID since = 0;
    std::uint32_t flags = 0;
  };
  std::vector<Creation> creations;                   ///< every stream asked for
  std::vector<platform::JournalEvent> afterHistory;  ///< one more batch, delivered after history done
  bool refuseWatchRoot = false;                      ///< no stream that watches its roots can be made
  bool refuseStart = false;                          ///< streams are made but do not start
  bool available = true;                             ///< streams can be made at all
  bool historyEnds = true;                           ///< the replay comes to its end
  std::atomic<int> liveStreams = 0;

 private:
  friend class InMemoryStream;
  platform::EventID newest_ = 1000;
  std::vector<platform::JournalEvent> events_;
};

/// A request made by hand. Its reply, or the error of a dropped request, can be waited for.
class InMemoryMessage : public platform::ConduitMessage {
 public:
  /// What became of the request; shared with the test.
  struct Answer {
    platform::Semaphore arrived;
    platform::Guarded<std::optional<platform::ConduitReply>> reply;

    void set(platform::ConduitReply value);
    /// Waits, within a generous limit.
    platform::ConduitReply wait();
    bool isThere() const { return reply.copy().has_value(); }
  };

  InMemoryMessage(platform::PropertyListValue contents, bool wantsReply, std::shared_ptr<Answer> answer)
      : contents_(std::move(contents)), wantsReply_(wantsReply), answer_(std::move(answer)) {}
  ~InMemoryMessage() override;
  const platform::PropertyListValue& contents() const override { return contents_; }
  void discardContents() override { contents_ = platform::PropertyListDictionary(); }
  bool canReply() const override { return wantsReply_; }
  void reply(const platform::PropertyListValue& contents) override;

 private:
  platform::PropertyListValue contents_;
  std::atomic<bool> wantsReply_;
  const std::shared_ptr<Answer> answer_;
};

/// Endpoints within the process: a connection's messages reach the listener on the listener's queue.
class InMemoryConduit : public platform::Conduit {
 public:
  void trackActivity() override { tracksActivity = true; }
  platform::ConduitListening listen(std::string_view name, platform::SerialQueue& queue,
                                    platform::ConduitEventHandler handler) override;
  std::shared_ptr<platform::ConduitConnection> connect(std::string_view name,
                                                       platform::SerialQueue& queue) override;

  /// Delivers any event to the listener.
  void deliver(const platform::ConduitEvent& event);

  bool tracksActivity = false;
  std::int64_t nextPeer = 4711;  ///< process id of the next connection's peer
  std::atomic<int> connections = 0;

 private:
  friend class InMemoryListener;
  friend class InMemoryClientConnection;
  struct Endpoint {
    platform::SerialQueue* queue = nullptr;
    platform::ConduitEventHandler handler;
  };
  platform::Guarded<std::shared_ptr<Endpoint>> endpoint_;
};

/// Knows the sandboxed processes by id; for the ids in `failing` the question fails.
class InMemorySandbox : public platform::SandboxQuery {
 public:
  int check(const platform::PeerProcess& process) override;
  std::vector<std::int64_t> sandboxed;
  std::vector<std::int64_t> failing;
};

/// A process whose main loop runs a test's work and then returns.
class InMemoryProcess : public platform::Process {
 public:
  void onTermination(platform::Task handler) override { termination = std::move(handler); }
  void exitNow(int status) override { exitStatus = status; }
  void runMainLoop() override {
    if (mainLoop) mainLoop();
  }

  platform::Task termination;
  platform::Task mainLoop;
  std::optional<int> exitStatus;
};

}  // namespace kel::test
