#pragma once

#include <algorithm>
#include <atomic>
#include <chrono>
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

/// Seeds in memory; posts are counted and reach nobody. Any thread.
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
    seeds_.with([&](auto& seeds) { ++seeds[registerName(name)].posts; });
  }
  std::unique_ptr<Observation> observe(const std::string&, platform::SerialQueue&,
                                       std::function<void()>) override {
    return nullptr;
  }

  std::size_t postsOf(const std::string& name) {
    return seeds_.with([&](auto& seeds) { return seeds[registerName(name)].posts; });
  }

 private:
  struct Seed {
    std::uint64_t state = 0;
    std::size_t posts = 0;
  };
  platform::Guarded<std::map<Token, Seed>> seeds_;
};

/// Streams that a test fires; the event at the start is left to the test.
class InMemoryLaunchEvents : public platform::LaunchEvents {
 public:
  void setHandler(std::string_view stream, platform::SerialQueue& queue,
                  std::function<void()> handler) override {
    streams.emplace_back(stream);
    fire[streams.back()] = [&queue, handler = std::move(handler)] { queue.async(handler); };
  }

  std::vector<std::string> streams;                   ///< in the order of their handlers
  std::map<std::string, std::function<void()>> fire;  ///< queues the stream's handler
};

/// Applications that provide services.
class InMemoryRegistry : public platform::ApplicationRegistry {
 public:
  std::vector<platform::RegisteredApplication> applications(std::uint32_t mask,
                                                            std::uint32_t value) override {
    ++queries;
    return mask & value & providesServices ? registered : std::vector<platform::RegisteredApplication>();
  }

  std::vector<platform::RegisteredApplication> registered;
  std::atomic<std::size_t> queries = 0;
};

/// A journal in memory: replays what was recorded, and misbehaves on demand. One test thread arranges it.
class InMemoryJournal : public platform::EventJournal {
 public:
  platform::EventID currentEventID() override { return newest_; }
  std::unique_ptr<platform::JournalStream> createStream(platform::JournalCallback callback,
                                                        const std::vector<std::string>& paths,
                                                        platform::EventID since, std::chrono::nanoseconds,
                                                        std::uint32_t flags) override {
    creations.push_back({since, flags});
    if (!available || (refuseWatchRoot && (flags & platform::stream_flags::watchRoot))) return nullptr;
    std::vector<platform::JournalEvent> batch;
    for (const platform::JournalEvent& event : events_) {
      const bool watched = std::any_of(paths.begin(), paths.end(), [&](const std::string& path) {
        return event.path.starts_with(path) || path.starts_with(event.path);
      });
      if (event.eventID > since && watched) batch.push_back(event);
    }
    if (historyEnds) batch.push_back({"", platform::event_flags::historyDone, newest_});
    return std::make_unique<Stream>(*this, std::move(callback), std::move(batch));
  }

  platform::SerialQueue& streamQueue() override { return streamQueue_; }

  /// Records an event at the next position.
  void record(const std::string& path, std::uint32_t flags = 0) {
    events_.push_back({path, flags, ++newest_});
  }

  struct Creation {
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
  class Stream : public platform::JournalStream {
   public:
    Stream(InMemoryJournal& journal, platform::JournalCallback callback,
           std::vector<platform::JournalEvent> batch)
        : journal_(journal), callback_(std::move(callback)), batch_(std::move(batch)) {
      ++journal_.liveStreams;
    }
    ~Stream() override { --journal_.liveStreams; }

    void setQueue(platform::SerialQueue& queue) override { queue_ = &queue; }
    bool start() override {
      if (journal_.refuseStart) return false;
      queue_->async([callback = callback_, batch = batch_] { callback(batch); });
      if (!journal_.afterHistory.empty()) {
        queue_->async([callback = callback_, later = journal_.afterHistory] { callback(later); });
      }
      return true;
    }
    void stop() override {}
    void invalidate() override {}

   private:
    InMemoryJournal& journal_;
    const platform::JournalCallback callback_;
    const std::vector<platform::JournalEvent> batch_;
    platform::SerialQueue* queue_ = nullptr;
  };

  platform::EventID newest_ = 1000;
  std::vector<platform::JournalEvent> events_;
  platform::SerialQueue streamQueue_{"kel VigilStream"};
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
