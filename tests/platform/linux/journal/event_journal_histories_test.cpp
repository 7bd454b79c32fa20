#include <array>
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
#include "platform/linux/journal/linux_event_journal.h"
#include "platform/linux/queues/linux_clock.h"
#include "platform/linux/scratch.h"

namespace kel::platform {
namespace {

namespace fs = std::filesystem;

/// What was found in each bundle, by path.
using Bundles = std::map<std::string, std::string>;

/// Random operations on a directory of bundles, on what links in them lead to, and on what is above them.
class Disk {
 public:
  Disk(const Scratch& scratch, unsigned seed, bool mounts)
      : root(scratch / "home/Services/"),
        home_(scratch / "home"),
        outside_(scratch / "outside/"),
        random_(seed),
        mounts_(mounts) {
    for (unsigned index = 0; index < 4; ++index) {
      makeBundle(root + bundleName(index));
      makeBundle(outside_ + "target" + std::to_string(index));
      makeBundle(outside_ + "spare" + std::to_string(index));
    }
    link(outside_ + "target0", root + "linked.service");
    fs::remove(root + bundleName(0) + "/Info.plist");
    link(outside_ + "target1/Info.plist", root + bundleName(0) + "/Info.plist");
    if (below(4) == 0) fs::rename(home_, outside_ + "late");
  }
  ~Disk() {
    close(kept_);
    unmountAll();
  }

  /// Every bundle with what a loader would find in it, links followed.
  Bundles snapshot() const {
    Bundles result;
    std::error_code ignored;
    for (const auto& entry : fs::directory_iterator(root, ignored)) {
      const int file = open((entry.path() / "Info.plist").c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC);
      std::array<char, 64> text;
      const ssize_t length = read(file, text.data(), text.size());
      struct stat status {};
      fstat(file, &status);
      result[entry.path()] = length < 0 ? "none"
                                        : std::to_string(status.st_mode) +
                                              std::string(text.data(), static_cast<std::size_t>(length));
      close(file);
    }
    return result;
  }

  void operate() {
    using Operation = void (Disk::*)();
    static constexpr Operation operations[] = {
        &Disk::write,         &Disk::write,           &Disk::truncate,
        &Disk::writeBeside,   &Disk::moveFileOut,     &Disk::moveFileIn,
        &Disk::replace,       &Disk::removeFile,      &Disk::changeMode,
        &Disk::retarget,      &Disk::writeBehindLink, &Disk::swapDirectories,
        &Disk::setOldTimes,   &Disk::addBundle,       &Disk::removeBundle,
        &Disk::moveBundleOut, &Disk::moveBundleIn,    &Disk::makeFolder,
        &Disk::renameBundle,  &Disk::linkHard,        &Disk::writeHard,
        &Disk::keepOpen,      &Disk::writeKept,       &Disk::writeMapped,
        &Disk::replaceRoot,   &Disk::swapHome,        &Disk::bind,
        &Disk::unbind};
    (this->*operations[below(std::size(operations))])();
    // The times of files follow the kernel's clock, whose ticks an operation may share with a look.
    if (below(40) == 0) waitForAnotherTick();
  }

  /// Another home, with bundles of its own; or, the second time, the first one as it was.
  void swapHome() {
    const std::string late = outside_ + "late";
    if (!fs::exists(late)) makeBundle(late + "/Services/" + bundleName(1));
    touchAll();
    if (!fs::exists(home_)) return move(late, home_);
    renameat2(AT_FDCWD, home_.c_str(), AT_FDCWD, late.c_str(), RENAME_EXCHANGE);
    touchAll();
  }

  unsigned below(std::size_t bound) { return static_cast<unsigned>(random_() % bound); }

  const std::string root;
  std::set<std::string> touched;  ///< bundles that an operation was about since this was cleared

 private:
  static std::string bundleName(unsigned index) { return "b" + std::to_string(index) + ".service"; }
  static void put(const std::string& path, const std::string& text) {
    std::ofstream(path, std::ios::binary) << text;
  }
  static void link(const std::string& target, const std::string& path) {
    std::error_code ignored;
    fs::create_symlink(target, path, ignored);
  }

  void makeBundle(const std::string& path) {
    std::error_code ignored;
    fs::create_directories(path + "/Resources/German", ignored);
    put(path + "/Info.plist", text());
  }

  /// Eight letters: so most writes leave the size as it was.
  std::string text() {
    std::string result(8, 'a');
    for (char& letter : result) letter = static_cast<char>('a' + below(26));
    return result;
  }

  std::string any(const std::string& directory) {
    std::vector<std::string> names;
    std::error_code ignored;
    for (const auto& entry : fs::directory_iterator(directory, ignored)) names.push_back(entry.path());
    std::sort(names.begin(), names.end());
    return names.empty() ? directory + "none" : names[below(names.size())];
  }
  std::string anyBundle() {
    std::string bundle = any(root);
    touched.insert(bundle);
    return bundle;
  }
  std::string anyFile() { return anyBundle() + "/Info.plist"; }
  /// For what is reached by several names: any of them may lead there.
  void touchAll() {
    for (const auto& [bundle, state] : snapshot()) touched.insert(bundle);
  }
  void move(const std::string& from, const std::string& to) { ::rename(from.c_str(), to.c_str()); }

  void write() { overwrite(anyFile()), touchAll(); }
  void overwrite(const std::string& file) {
    const int descriptor = open(file.c_str(), O_WRONLY | O_NONBLOCK | O_CLOEXEC);
    if (descriptor >= 0 && pwrite(descriptor, text().data(), 8, 0) < 0) perror("pwrite");
    close(descriptor);
  }
  void truncate() {
    if (::truncate(anyFile().c_str(), below(9)) == 0) touchAll();
  }
  void writeBeside() {
    const std::string bundle = any(root);
    put(bundle + "/file" + std::to_string(below(3)), text());
    put(bundle + "/Resources/German/ServicesMenu.strings", text());
  }
  void moveFileOut() { move(anyFile(), outside_ + "kept"); }
  void moveFileIn() { move(outside_ + "kept", anyBundle() + "/Info.plist"); }
  void replace() {
    put(outside_ + "new", text());
    move(outside_ + "new", anyFile());
  }
  void removeFile() { unlink(anyFile().c_str()); }
  void changeMode() { chmod(anyFile().c_str(), below(2) ? 0600 : 0644), touchAll(); }
  void retarget() {
    const std::string path = root + "linked.service";
    touched.insert(path);
    std::error_code ignored;
    fs::remove_all(path, ignored);
    link(outside_ + "target" + std::to_string(below(4)), path);
  }
  void writeBehindLink() {
    touchAll();
    overwrite(outside_ + "target" + std::to_string(below(3)) + "/Info.plist");
  }
  void swapDirectories() {
    const std::string one = anyBundle(), other = anyBundle();
    renameat2(AT_FDCWD, one.c_str(), AT_FDCWD, other.c_str(), RENAME_EXCHANGE);
  }
  void setOldTimes() {
    const timespec times[2] = {{1'000'000'000, 0}, {1'000'000'000, 0}};
    utimensat(AT_FDCWD, anyFile().c_str(), times, 0), touchAll();
  }
  void addBundle() {
    const std::string bundle = root + bundleName(below(6));
    touched.insert(bundle);
    if (fs::exists(root)) makeBundle(bundle);
  }
  void removeBundle() {
    std::error_code ignored;
    fs::remove_all(anyBundle(), ignored);
  }
  void moveBundleOut() { move(anyBundle(), outside_ + "gone" + std::to_string(below(3))); }
  void moveBundleIn() {
    const std::string bundle = root + bundleName(below(6));
    touched.insert(bundle);
    move(any(outside_), bundle);
  }
  void renameBundle() {
    const std::string bundle = root + bundleName(below(6));
    touched.insert(bundle);
    move(anyBundle(), bundle);
  }
  void makeFolder() {
    std::error_code ignored;
    fs::create_directories(any(root) + "/Resources/French/deep", ignored);
  }
  void linkHard() {
    std::error_code ignored;
    fs::remove(outside_ + "hard", ignored);
    fs::create_hard_link(anyFile(), outside_ + "hard", ignored), touchAll();
  }
  void writeHard() { overwrite(outside_ + "hard"), touchAll(); }
  void keepOpen() {
    close(kept_);
    linkHard();
    kept_ = open((outside_ + "hard").c_str(), O_RDWR | O_CLOEXEC);
    unlink((outside_ + "hard").c_str());
  }
  void writeKept() {
    touchAll();
    if (kept_ >= 0 && pwrite(kept_, text().data(), 8, 0) < 0) perror("pwrite");
  }
  void writeMapped() {
    const int file = open(anyFile().c_str(), O_RDWR | O_NONBLOCK | O_CLOEXEC);
    if (file >= 0 && ftruncate(file, 8) == 0) {
      void* const mapped = mmap(nullptr, 8, PROT_READ | PROT_WRITE, MAP_SHARED, file, 0);
      close(file);
      if (mapped == MAP_FAILED) return;
      text().copy(static_cast<char*>(mapped), 8);
      munmap(mapped, 8), touchAll();
    }
  }
  void replaceRoot() {
    const std::string other = outside_ + "other";
    makeBundle(other + "/" + bundleName(0));
    touchAll();
    renameat2(AT_FDCWD, root.substr(0, root.size() - 1).c_str(), AT_FDCWD, other.c_str(), RENAME_EXCHANGE);
    touchAll();
    std::error_code ignored;
    fs::remove_all(other, ignored);
  }
  void bind() {
    const std::string over = below(2) ? anyFile() : anyBundle();
    const std::string under = outside_ + "spare" + std::to_string(below(4));
    const bool isFile = over.ends_with(".plist");
    if (!mounts_ || !fs::exists(over) || fs::is_directory(over) == isFile) return;
    const std::string from = isFile ? under + "/Info.plist" : under;
    touchAll();
    mount(from.c_str(), over.c_str(), nullptr, MS_BIND, nullptr);
    overwrite(over), overwrite(from), touchAll();
  }
  void unbind() { touchAll(), unmountAll(), touchAll(); }

  /// By the kernel's table: what is mounted on moves with the directories above it.
  void unmountAll() {
    std::vector<std::string> points;
    std::ifstream table("/proc/self/mountinfo");
    for (std::string line; std::getline(table, line);) {
      std::istringstream fields(line);
      std::string field, point;
      for (int count = 0; count < 4; ++count) fields >> field;
      fields >> point;
      if (point.starts_with(fs::path(home_).parent_path().string() + "/")) points.push_back(point);
    }
    while (!points.empty()) umount2(points.back().c_str(), MNT_DETACH), points.pop_back();
  }

  static void waitForAnotherTick() {
    const std::int64_t start = timeStampNow();
    while (timeStampNow() < start + 25'000'000) std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }

  const std::string home_;
  const std::string outside_;
  std::mt19937 random_;
  const bool mounts_;
  int kept_ = -1;
};

/// Writes without waiting for the disk, or not at all.
class TestFiles : public FileSystem {
 public:
  explicit TestFiles(SystemLog& log) : files_(log) {}

  std::optional<std::vector<std::string>> listDirectory(const std::string& directory) override {
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
    Bundles bundles;
  };
  Cache cache;

  /// Brings the cache up to date as the data store does; the bundles that were loaded without need.
  std::size_t update(const std::set<std::string>& touched = {}) {
    KELPathChangesObserver observer(*journal_, clock_, cache.position);
    const bool isFull = cache.position == 0;
    cache.position = journal_->currentEventID();
    const Bundles before = std::exchange(cache.bundles, disk_.snapshot());
    if (isFull) return 0;
    observer.observeChangesUnderPaths({disk_.root});
    bool isListed = observer.pathChangedOrRequiresRescan(disk_.root);
    for (const std::string& path : observer.changedPathsUnderPath(disk_.root)) {
      isListed |= std::none_of(before.begin(), before.end(),
                               [&](const auto& bundle) { return path.starts_with(bundle.first); });
    }
    if (!isListed) cache.bundles = before;
    std::size_t needless = 0;
    const Bundles now = disk_.snapshot();
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
    journal_->setRoots({{disk_.root, false}});
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
      const Bundles now = disk_.snapshot();
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
