// The event journal over the corpus that KEL_BENCH_CORPUS names, against bare programs that do no more than
// they must: each iteration runs both, one after the other, and the counters tell how they compare.

#include <atomic>
#include <benchmark/benchmark.h>
#include <chrono>
#include <condition_variable>
#include <cstdlib>
#include <dirent.h>
#include <fcntl.h>
#include <filesystem>
#include <functional>
#include <malloc.h>
#include <mutex>
#include <string>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>
#include <vector>

#include "platform/linux/files/files.h"
#include "platform/linux/files/linux_file_system.h"
#include "platform/linux/journal/linux_event_journal.h"

namespace {

using namespace kel::platform;
namespace fs = std::filesystem;

class SilentLog : public SystemLog {
 public:
  void write(std::string_view) override {}
};

/// The names in `directory`, each handed to `visit` with whether it is a directory.
void list(const std::string& directory, const std::function<void(int, const char*, bool)>& visit) {
  const DirectoryListing listing = openListing(directory);
  while (const dirent* entry = listing ? readdir(listing.get()) : nullptr) {
    const std::string_view name(entry->d_name);
    if (name != "." && name != "..") visit(dirfd(listing.get()), entry->d_name, entry->d_type == DT_DIR);
  }
}

/// Walks the tree on every processor and asks the status of every inode once.
class BareWalk {
 public:
  explicit BareWalk(std::string root) { directories_.push_back(std::move(root)); }

  void run() {
    std::vector<std::jthread> threads;
    for (unsigned index = 0; index < std::thread::hardware_concurrency(); ++index) {
      threads.emplace_back([this] { work(); });
    }
  }

 private:
  void work() {
    std::vector<std::string> taken;
    std::vector<std::string> found;
    for (;;) {
      {
        std::unique_lock lock(mutex_);
        working_ -= !taken.empty();
        directories_.insert(directories_.end(), found.begin(), found.end());
        if (!found.empty() || working_ == 0) changed_.notify_all();
        changed_.wait(lock, [this] { return !directories_.empty() || working_ == 0; });
        if (directories_.empty()) return;
        taken.clear();
        for (int count = 0; count < 16 && !directories_.empty(); ++count) {
          taken.push_back(std::move(directories_.back()));
          directories_.pop_back();
        }
        ++working_;
      }
      found.clear();
      for (const std::string& directory : taken) {
        list(directory, [&](int descriptor, const char* name, bool isDirectory) {
          struct statx status {};
          statx(descriptor, name, AT_SYMLINK_NOFOLLOW, STATX_BASIC_STATS, &status);
          if (isDirectory) found.push_back(directory + "/" + name);
        });
      }
    }
  }

  std::mutex mutex_;
  std::condition_variable changed_;
  std::vector<std::string> directories_;
  int working_ = 0;
};

/// Finds every directory and watches it.
void watchBarely(int inotify, const std::string& directory) {
  inotify_add_watch(inotify, directory.c_str(), IN_CREATE | IN_DELETE | IN_MOVE | IN_MODIFY | IN_ATTRIB);
  list(directory, [&](int, const char* name, bool isDirectory) {
    if (isDirectory) watchBarely(inotify, directory + "/" + name);
  });
}

/// A journal of the corpus and its index file.
class Journal {
 public:
  Journal(const std::string& corpus, bool live)
      : corpus_(corpus), state_(corpus + (live ? ".live-journal" : ".journal")) {
    options_.directory = state_;
    options_.applicationDirectories = {corpus_ + "/Applications/"};
    options_.limits.mayWatch = [live] { return live; };
    options_.betweenSavings = std::chrono::milliseconds(0);
    fs::remove_all(state_);
    const std::size_t before = mallinfo2().uordblks;
    const auto begin = std::chrono::steady_clock::now();
    start();
    firstLook = std::chrono::duration<double>(std::chrono::steady_clock::now() - begin).count();
    heap = mallinfo2().uordblks - before;
    size = journal_->service()->size();
    stop();
  }
  ~Journal() { fs::remove_all(state_); }

  /// From nothing to the answer that nothing changed, or to the last watch.
  void start() {
    journal_ = std::make_unique<LinuxEventJournal>(options_, files_, log_, pool_);
    journal_->watch({corpus_ + "/Library/Services/"});
    journal_->service()->save();
  }
  void stop() { journal_.reset(); }

  double firstLook = 0;  ///< in seconds, until it is on the disk
  std::size_t heap = 0;  ///< bytes of memory after it
  JournalForest::Size size;

 private:
  const std::string corpus_;
  const std::string state_;
  SilentLog log_;
  LinuxFileSystem files_{log_};
  ConcurrentQueue pool_;
  JournalOptions options_;
  std::unique_ptr<LinuxEventJournal> journal_;
};

double seconds(const std::function<void()>& work) {
  const auto start = std::chrono::steady_clock::now();
  work();
  return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}

void compare(benchmark::State& state, bool live, const std::function<double(const std::string&)>& bare) {
  const char* corpus = std::getenv("KEL_BENCH_CORPUS");
  if (!corpus) return state.SkipWithError("KEL_BENCH_CORPUS names no corpus");
  Journal journal(corpus, live);
  double bareTime = 0;
  double journalTime = 0;
  for (auto _ : state) {
    bareTime += bare(corpus);
    const double time = seconds([&] { journal.start(); });
    journalTime += time;
    state.SetIterationTime(time);
    journal.stop();
  }
  state.counters["bare_ms"] = benchmark::Counter(bareTime * 1000, benchmark::Counter::kAvgIterations);
  state.counters["ratio"] = journalTime / bareTime;
  state.counters["first_ms"] = journal.firstLook * 1000;
  state.counters["records"] = static_cast<double>(journal.size.records);
  state.counters["watches"] = static_cast<double>(journal.size.watches);
  state.counters["heap_MB"] = static_cast<double>(journal.heap) / 1e6;
}

/// A restart without changes: reading the index and comparing the disk with it.
void BM_ComparisonAgainstABareWalk(benchmark::State& state) {
  compare(state, false, [](const std::string& corpus) {
    return seconds([&corpus] {
      BareWalk(corpus + "/Library/Services").run();
      BareWalk(corpus + "/Applications").run();
    });
  });
}
BENCHMARK(BM_ComparisonAgainstABareWalk)->Unit(benchmark::kMillisecond)->UseManualTime();

/// The same with a watch on every directory.
void BM_WatchingAgainstBareWatches(benchmark::State& state) {
  compare(state, true, [](const std::string& corpus) {
    const OwnedDescriptor inotify(inotify_init1(IN_CLOEXEC));
    return seconds([&] {
      watchBarely(inotify.get(), corpus + "/Library/Services");
      watchBarely(inotify.get(), corpus + "/Applications");
    });
  });
}
BENCHMARK(BM_WatchingAgainstBareWatches)->Unit(benchmark::kMillisecond)->UseManualTime();

}  // namespace
