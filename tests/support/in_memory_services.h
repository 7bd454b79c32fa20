#pragma once

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdint>
#include <deque>
#include <functional>
#include <iterator>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/platform.h"

namespace kel::test {

/// Facts that a test sets; random numbers come from a list, whose last one repeats.
class InMemoryFacts : public platform::SystemFacts {
 public:
  std::string buildVersion() override { return "linux 1"; }
  platform::SystemReading bootTime() override { return boot; }
  platform::SystemReading auditSession() override { return session; }
  std::uint32_t realUserID() override { return 501; }
  std::uint32_t random32() override {
    const std::uint32_t number = randomNumbers.front();
    if (randomNumbers.size() > 1) randomNumbers.pop_front();
    return number;
  }
  std::optional<std::string> environmentVariable(const std::string& name) override {
    return environment.contains(name) ? std::optional(environment[name]) : std::nullopt;
  }

  platform::SystemReading boot{1700000000, 0, {}};
  platform::SystemReading session{100004, 0, {}};
  std::deque<std::uint32_t> randomNumbers{7};
  std::map<std::string, std::string> environment;
};

/// Keeps what is logged, whole and in order. Any thread.
class RecordingLog : public platform::SystemLog {
 public:
  void write(std::string_view message) override {
    messages_.with([&](auto& messages) { messages.emplace_back(message); });
  }
  /// The messages so far, which are forgotten.
  std::vector<std::string> take() {
    return messages_.with([](auto& messages) { return std::exchange(messages, {}); });
  }

  std::vector<std::string> messages() const { return messages_.copy(); }

 private:
  platform::Guarded<std::vector<std::string>> messages_;
};

/// Keeps the last publication: it is the preference that other processes read. Any thread.
class InMemoryPublication : public platform::ServicesPublication, public platform::Preferences {
 public:
  void publish(const platform::PropertyListValue& publication) override { last_.set(publication); }
  std::optional<platform::PropertyListValue> value(std::string_view domain, std::string_view key) override {
    const bool own = domain == "com.orvex.ServicesMenu.Services" && key == "QVServices";
    return own ? last_.copy() : std::nullopt;
  }

 private:
  platform::Guarded<std::optional<platform::PropertyListValue>> last_;
};

class CountingTransactions : public platform::Transactions {
 public:
  void open() override { ++openCount; }
  void close() override { --openCount; }
  std::atomic<int> openCount = 0;
};

/// Seeds in memory; posts are counted, too. Any thread; no queue that observes ends during a post.
class InMemorySeeds : public platform::NotificationSeeds {
 public:
  Token registerName(const std::string& name) override {
    return static_cast<Token>(std::hash<std::string>()(name));
  }
  std::uint64_t state(Token token) override {
    return seeds_.with([&](auto& seeds) { return seeds[token].state; });
  }
  void setState(Token token, std::uint64_t state) override {
    seeds_.with([&](auto& seeds) { seeds[token].state = state; });
  }
  void post(const std::string& name) override {
    seeds_.with([&](auto& seeds) {
      Seed& seed = seeds[registerName(name)];
      ++seed.posts;
      for (const auto& [queue, observer] : seed.observers) {
        if (!observer.expired()) queue->async([observer = observer] { call(observer.lock()); });
      }
    });
  }
  std::unique_ptr<Observation> observe(const std::string& name, platform::SerialQueue& queue,
                                       std::function<void()> posted) override {
    auto observer = std::make_shared<const Observer>(std::move(posted));
    seeds_.with([&](auto& seeds) { seeds[registerName(name)].observers.emplace_back(&queue, observer); });
    return std::make_unique<Watch>(std::move(observer));
  }

  std::size_t postsOf(const std::string& name) {
    return seeds_.with([&](auto& seeds) { return seeds[registerName(name)].posts; });
  }

 private:
  using Observer = std::function<void()>;
  struct Watch : Observation {
    explicit Watch(std::shared_ptr<const Observer> watching) : observer(std::move(watching)) {}
    const std::shared_ptr<const Observer> observer;
  };
  struct Seed {
    std::uint64_t state = 0;
    std::size_t posts = 0;
    std::vector<std::pair<platform::SerialQueue*, std::weak_ptr<const Observer>>> observers;
  };
  static void call(const std::shared_ptr<const Observer>& observer) {
    if (observer) (*observer)();
  }

  platform::Guarded<std::map<Token, Seed>> seeds_;
};

/// Streams that fire at the start and when a test says so.
class InMemoryLaunchEvents : public platform::LaunchEvents {
 public:
  void setHandler(std::string_view stream, platform::SerialQueue& queue,
                  std::function<void()> handler) override {
    streams.emplace_back(stream);
    const auto found = fire.find(streams.back());
    if (found == fire.end()) return;
    found->second = [&queue, handler = std::move(handler)] { queue.async(handler); };
    found->second();
  }

  std::vector<std::string> streams;  ///< in the order of their handlers
  /// By stream; each queues the handler.
  std::map<std::string, std::function<void()>> fire{{"com.orvex.beacond.matching", {}},
                                                    {"com.orvex.broadcastd.matching", {}},
                                                    {"com.orvex.vigil.matching", {}}};
};

/// Applications that a test installs: those with services come first.
class InMemoryRegistry : public platform::ApplicationRegistry {
 public:
  platform::RegisteredApplications applications(std::uint32_t mask, std::uint32_t value) override {
    ++queries;
    auto result = (providesServices & mask) == value ? registered : decltype(registered)();
    if (value == 0) result.insert(result.end(), plain.begin(), plain.end());
    return {std::move(result), isWhole};
  }

  bool isWhole = true;  ///< else applications may be missing for the moment
  std::vector<platform::RegisteredApplication> registered;  ///< that provide services
  std::vector<platform::RegisteredApplication> plain;       ///< that set no flag
  std::atomic<std::size_t> queries = 0;
};

/// A journal in memory: tells what is recorded, and misbehaves on demand. One test thread arranges it.
class InMemoryJournal : public platform::EventJournal {
 public:
  void watch(const std::vector<std::string>& directories) override { watchedDirectories = directories; }
  platform::EventID currentEventID() override { return newest_; }
  std::unique_ptr<platform::JournalStream> createStream(platform::JournalCallback callback,
                                                        const std::vector<std::string>& paths,
                                                        platform::EventID since, std::chrono::nanoseconds,
                                                        std::uint32_t flags) override {
    creations.push_back({since, flags});
    if (!available || (refuseWatchRoot && (flags & platform::stream_flags::watchRoot))) return nullptr;
    return std::make_unique<Stream>(*this, std::move(callback), paths, since);
  }

  /// Records an event at the next position.
  void record(const std::string& path, std::uint32_t flags = 0) {
    events_.push_back({path, flags, ++newest_});
  }

  struct Creation {
    platform::EventID since = 0;
    std::uint32_t flags = 0;
  };
  std::vector<std::string> watchedDirectories;  ///< what `watch` was told
  std::vector<Creation> creations;              ///< every stream asked for
  bool refuseWatchRoot = false;                 ///< no stream that watches its roots can be made
  bool refuseStart = false;                     ///< streams are made but do not start
  bool available = true;                        ///< streams can be made at all
  bool historyEnds = true;                      ///< the replay comes to its end
  std::atomic<int> liveStreams = 0;

 private:
  class Stream : public platform::JournalStream {
   public:
    Stream(InMemoryJournal& journal, platform::JournalCallback callback, std::vector<std::string> paths,
           platform::EventID since)
        : journal_(journal), callback_(std::move(callback)), paths_(std::move(paths)), since_(since) {
      ++journal_.liveStreams;
    }
    ~Stream() override { --journal_.liveStreams; }

    void setQueue(platform::SerialQueue& queue) override { queue_ = &queue; }
    bool start() override {
      if (journal_.refuseStart || !queue_) return false;
      const auto isWatched = [this](const platform::JournalEvent& event) {
        return event.eventID > since_ && std::any_of(paths_.begin(), paths_.end(), [&](const auto& path) {
                 return isIn(event.path, path) || isIn(path, event.path);
               });
      };
      std::vector<platform::JournalEvent> batch;
      std::copy_if(journal_.events_.begin(), journal_.events_.end(), std::back_inserter(batch), isWatched);
      if (journal_.historyEnds) batch.push_back({"", platform::event_flags::historyDone, journal_.newest_});
      queue_->async([isClosed = isClosed_, callback = callback_, batch = std::move(batch)] {
        if (!*isClosed) callback(batch);
      });
      return true;
    }
    void stop() override { *isClosed_ = true; }
    void invalidate() override { *isClosed_ = true; }

   private:
    static bool isIn(const std::string& path, const std::string& directory) {
      return platform::joinPath(path, "").starts_with(platform::joinPath(directory, ""));
    }

    InMemoryJournal& journal_;
    const platform::JournalCallback callback_;
    const std::vector<std::string> paths_;
    const platform::EventID since_;
    platform::SerialQueue* queue_ = nullptr;
    const std::shared_ptr<std::atomic<bool>> isClosed_ = std::make_shared<std::atomic<bool>>(false);
  };

  platform::EventID newest_ = 1000;
  std::vector<platform::JournalEvent> events_;
};

/// A process whose main loop runs a test's work and then returns.
class InMemoryProcess : public platform::Process {
 public:
  void onTermination(platform::Task) override {}
  void exitNow(int) override {}
  void runMainLoop() override {
    if (mainLoop) mainLoop();
  }

  platform::Task mainLoop;
};

}  // namespace kel::test
