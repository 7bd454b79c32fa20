#include <fcntl.h>
#include <map>
#include <random>
#include <sched.h>
#include <sstream>
#include <stdio.h>
#include <sys/mman.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>

#include "discovery/path_changes_observer.h"
#include "platform/linux/journal/journal_disk.h"
#include "platform/linux/journal/linux_event_journal.h"
#include "platform/linux/queues/linux_clock.h"

namespace kel::platform {
namespace {

/// Writes without waiting for the disk, or not at all.
class TestFiles : public FileSystem {
 public:
  explicit TestFiles(SystemLog& log) : files_(log) {}

  DirectoryReading listDirectory(const std::string& directory) override {
    return files_.listDirectory(directory);
  }
  bool exists(const std::string& path) override { return files_.exists(path); }
  FileReading read(const std::string& path, std::size_t largest) override {
    return files_.read(path, largest);
  }
  std::optional<std::string> writeAtomically(const std::string& path, BytesView bytes) override {
    if (isFull) return path + ": full";
    if (const auto error = files_.writePlainly(path + ".new", bytes)) return error;
    fs::rename(path + ".new", path);
    return std::nullopt;
  }
  std::optional<std::string> writePlainly(const std::string& path, BytesView bytes) override {
    return files_.writePlainly(path, bytes);
  }
  bool remove(const std::string& path) override { return files_.remove(path); }

  std::atomic<bool> isFull = false;

 private:
  LinuxFileSystem files_;
};

enum class Watching { All, Some, None, AtTimes };

/// A journal that is killed, started and asked as the server does, and what the server would have loaded.
class Server {
 public:
  Server(const Scratch& scratch, const Disk& disk, Watching watching) : scratch_(scratch), disk_(disk) {
    fs::create_directories(scratch / "state");
    options_.directory = scratch / "state";
    options_.limits.home = scratch.path();
    if (watching == Watching::Some) options_.limits.mostWatches = 4;
    hasInstance = watching != Watching::None;
    options_.limits.mayWatch = [this] { return hasInstance.load(); };
    options_.betweenSavings = options_.beforeFirstLook = std::chrono::milliseconds(0);
    options_.betweenLooks = std::chrono::milliseconds(20);
    start();
  }

  void restart() {
    journal_.reset();
    start();
  }
  void save() { journal_->service()->save(); }

  /// What was on the disk of a server at some time.
  struct State {
    std::string index, positions;
  };
  State state() const { return {scratch_.read("state/journal"), scratch_.read("state/journal-position")}; }
  void restore(const State& state) {
    journal_.reset();
    scratch_.write("state/journal", state.index);
    scratch_.write("state/journal-position", state.positions);
    start();
  }

  /// What an update keeps in its cache.
  struct Cache {
    EventID position = 0;
    FoundBundles bundles;
  };
  Cache cache;

  /// Brings the cache up to date as the data store does; the bundles that were loaded without need.
  std::size_t update(const std::set<std::string>& touched = {}) {
    KELPathChangesObserver observer(*journal_, clock_, cache.position);
    const bool isFull = cache.position == 0;
    cache.position = journal_->currentEventID();
    const FoundBundles before = std::exchange(cache.bundles, disk_.snapshot());
    if (isFull) return 0;
    observer.observeChangesUnderPaths({disk_.root});
    bool isListed = observer.pathChangedOrRequiresRescan(disk_.root);
    for (const std::string& path : observer.changedPathsUnderPath(disk_.root)) {
      isListed |= std::none_of(before.begin(), before.end(),
                               [&](const auto& bundle) { return path.starts_with(bundle.first); });
    }
    if (!isListed) cache.bundles = before;
    std::size_t needless = 0;
    const FoundBundles now = disk_.snapshot();
    for (auto& [bundle, state] : cache.bundles) {
      const auto known = before.find(bundle);
      if (known == before.end()) continue;
      if (observer.pathChangedOrRequiresRescan(bundle) || !observer.changedPathsUnderPath(bundle).empty()) {
        const auto loaded = now.find(bundle);
        state = loaded == now.end() ? "none" : loaded->second;
        needless += state == known->second && !touched.contains(bundle) &&
                    !observer.pathChangedOrRequiresRescan(disk_.root);
      } else {
        state = known->second;
      }
    }
    return needless;
  }

  test::RecordingLog log;
  TestFiles files{log};
  std::atomic<bool> hasInstance = true;
  Semaphore news;  ///< signalled for every hint

 private:
  void start() {
    journal_.emplace(options_, files, log, pool_);
    journal_->watch({disk_.root});
    journal_->start([this](JournalForest::Hints) { news.signal(); });
  }

  const Scratch& scratch_;
  const Disk& disk_;
  LinuxClock clock_;
  ConcurrentQueue pool_;
  JournalOptions options_;
  std::optional<LinuxEventJournal> journal_;
};

struct Tally {
  std::size_t operations = 0;
  std::size_t asked = 0;
  std::size_t needless = 0;
};

/// One history: rounds of operations, of the server's misfortunes, and an update.
class History {
 public:
  History(unsigned seed, Watching watching, bool mounts, Tally& tally)
      : watching_(watching),
        disk_(scratch_, seed, mounts),
        server_(scratch_, disk_, watching),
        tally_(tally) {}

  void run() {
    server_.update();
    for (int round = 0; round < 8 && !testing::Test::HasFailure(); ++round) {
      caches_.push_back(server_.cache);
      states_.push_back(server_.state());
      disk_.touched.clear();
      bool isPlain = true;
      while (server_.news.wait({})) {
      }
      for (unsigned left = disk_.below(7); left > 0; --left, ++tally_.operations) {
        disk_.operate();
        if (disk_.below(4) == 0) isPlain &= misfortune();
      }
      const FoundBundles now = disk_.snapshot();
      if (isPlain && now != server_.cache.bundles) {
        EXPECT_TRUE(server_.news.wait(std::chrono::seconds(20))) << "nobody who waits is told";
      }
      const std::size_t needless = server_.update(disk_.touched);
      EXPECT_EQ(server_.cache.bundles, now);
      // What changed before the first position of a process is told once more.
      if (!isPlain) server_.update();
      if (!isPlain) continue;
      tally_.asked += now.size();
      tally_.needless += needless;
    }
  }

 private:
  /// False when it may cost bundles that did not change.
  bool misfortune() {
    switch (disk_.below(9)) {
      case 0:
        return server_.restart(), false;
      case 1:
        return server_.save(), true;
      case 2:
        return server_.save(), server_.restart(), false;
      case 3:
        return server_.restore(states_[disk_.below(states_.size())]), false;
      case 4:
        return server_.cache = caches_[disk_.below(caches_.size())], false;
      case 5:
        server_.restore(states_[disk_.below(states_.size())]);
        return server_.cache = caches_[disk_.below(caches_.size())], false;
      case 6:
        return server_.files.isFull = !server_.files.isFull, false;
      case 7:
        // Told while another home was there, which is gone before the next server looks.
        disk_.swapHome(), server_.update(), disk_.swapHome();
        return server_.restart(), false;
      default:
        if (watching_ == Watching::AtTimes) server_.hasInstance = !server_.hasInstance;
        return true;
    }
  }

  const Watching watching_;
  const Scratch scratch_;
  Disk disk_;
  Server server_;
  Tally& tally_;
  std::vector<Server::Cache> caches_;
  std::vector<Server::State> states_;
};

/// Into a mount namespace of our own, for the rest of this process; false where that is not allowed.
bool mayMount() {
  const std::string user = std::to_string(getuid()), group = std::to_string(getgid());
  const auto put = [](const char* path, const std::string& text) { std::ofstream(path) << text; };
  if (unshare(getuid() == 0 ? CLONE_NEWNS : CLONE_NEWUSER | CLONE_NEWNS) != 0) return false;
  if (getuid() != 0) {
    put("/proc/self/setgroups", "deny");
    put("/proc/self/uid_map", user + " " + user + " 1");
    put("/proc/self/gid_map", group + " " + group + " 1");
  }
  return mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0;
}

std::size_t operationsOfEach() {
  const char* wanted = std::getenv("KEL_HISTORY_OPERATIONS");
  return (wanted ? std::stoul(wanted) : 10'000) / 5;
}

class EventJournalHistories : public testing::TestWithParam<Watching> {
 protected:
  void run(bool mounts) {
    Tally tally;
    for (unsigned seed = 1; tally.operations < operationsOfEach() && !HasFailure(); ++seed) {
      SCOPED_TRACE("seed " + std::to_string(seed));
      History(seed, GetParam(), mounts, tally).run();
    }
    EXPECT_LE(tally.needless * 100, tally.asked) << tally.needless << " of " << tally.asked;
    EXPECT_GT(tally.asked * 4, tally.operations) << "too few plain rounds to tell";
    RecordProperty("operations", static_cast<int>(tally.operations));
    RecordProperty("needless", static_cast<int>(tally.needless));
  }
};
INSTANTIATE_TEST_SUITE_P(Watching, EventJournalHistories,
                         testing::Values(Watching::All, Watching::Some, Watching::None, Watching::AtTimes));

TEST_P(EventJournalHistories, TheCacheIsTheDiskAfterEveryUpdateAndHardlyAnythingIsLoadedInVain) {
  run(false);
}

using EventJournalMounts = EventJournalHistories;
INSTANTIATE_TEST_SUITE_P(Live, EventJournalMounts, testing::Values(Watching::All));

TEST_P(EventJournalMounts, WhatIsMountedOverABundleOrItsDictionaryIsTold) {
  if (!mayMount()) GTEST_SKIP() << "no mount namespace to be had";
  run(true);
}

TEST_P(EventJournalHistories, WhatRacesWithAQuestionIsToldNowOrNextTime) {
  for (unsigned seed = 1; seed <= 20 && !HasFailure(); ++seed) {
    SCOPED_TRACE(seed);
    const Scratch scratch;
    Disk disk(scratch, seed, false);
    Server server(scratch, disk, GetParam());
    server.update();
    {
      std::jthread operations([&disk] {
        for (int count = 0; count < 25; ++count) disk.operate();
      });
      for (int count = 0; count < 8; ++count) server.update();
    }
    server.update();
    EXPECT_EQ(server.cache.bundles, disk.snapshot());
  }
}

}  // namespace
}  // namespace kel::platform
