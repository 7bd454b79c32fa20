#include <fcntl.h>
#include <map>
#include <random>
#include <stdio.h>
#include <thread>
#include <unistd.h>

#include "discovery/path_changes_observer.h"
#include "platform/linux/journal/linux_event_journal.h"
#include "platform/linux/queues/linux_clock.h"
#include "platform/linux/scratch.h"

namespace kel::platform {
namespace {

namespace fs = std::filesystem;

/// Random operations on a directory of bundles, on the bundles' contents and on what links in them lead to.
class Disk {
 public:
  Disk(const Scratch& scratch, unsigned seed)
      : root(scratch / "Services/"), outside_(scratch / "outside/"), random_(seed) {
    fs::create_directories(root);
    for (unsigned index = 0; index < 4; ++index) {
      makeBundle(root + bundleName(index));
      makeBundle(outside_ + "target" + std::to_string(index));
      makeBundle(outside_ + "spare" + std::to_string(index));
    }
    link(outside_ + "target0", root + "linked.service");
    link(outside_ + "target1/Info.plist", root + bundleName(0) + "/shared.plist");
    fs::create_hard_link(outside_ + "target2/Info.plist", root + bundleName(1) + "/hard.plist");
  }

  /// Names and contents of every bundle as a loader would find them, links followed.
  std::map<std::string, std::string> snapshot() const {
    std::map<std::string, std::string> result;
    std::error_code ignored;
    for (const auto& entry : fs::directory_iterator(root, ignored)) {
      describe(entry.path(), result[entry.path()], 0);
    }
    return result;
  }

  void operate() {
    using Operation = void (Disk::*)();
    static constexpr Operation operations[] = {
        &Disk::write,           &Disk::write,        &Disk::create,     &Disk::truncate,
        &Disk::renameWithin,    &Disk::moveFileOut,  &Disk::moveFileIn, &Disk::replace,
        &Disk::removeFile,      &Disk::changeMode,   &Disk::retarget,   &Disk::writeBehindLink,
        &Disk::swapDirectories, &Disk::setOldTimes,  &Disk::addBundle,  &Disk::removeBundle,
        &Disk::moveBundleOut,   &Disk::moveBundleIn, &Disk::makeFolder, &Disk::renameBundle};
    (this->*operations[below(std::size(operations))])();
    // The times of files follow the kernel's clock, whose ticks an operation may share with a look.
    if (below(12) == 0) waitForAnotherTick();
  }

  void replaceRoot() {
    const std::string other = outside_ + "other";
    fs::create_directories(other);
    makeBundle(other + "/" + bundleName(0));
    renameat2(AT_FDCWD, root.substr(0, root.size() - 1).c_str(), AT_FDCWD, other.c_str(), RENAME_EXCHANGE);
    for (const auto& [bundle, state] : snapshot()) touched.insert(bundle);
    fs::remove_all(other);
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
    put(path + "/Resources/German/ServicesMenu.strings", text());
  }

  /// Eight letters: so most writes leave the size as it was.
  std::string text() {
    std::string result(8, 'a');
    for (char& letter : result) letter = static_cast<char>('a' + below(26));
    return result;
  }

  static void describe(const fs::path& path, std::string& result, int depth) {
    std::error_code error;
    result += path.filename().string() + " " +
              std::to_string(static_cast<unsigned>(fs::status(path, error).permissions()));
    if (fs::is_directory(path, error) && depth < 8) {
      std::set<fs::path> entries;
      for (const auto& entry : fs::directory_iterator(path, error)) entries.insert(entry.path());
      for (const fs::path& entry : entries) describe(entry, result, depth + 1);
      result += " end";
    } else {
      std::ifstream file(path, std::ios::binary);
      result += "=" + std::string{std::istreambuf_iterator<char>(file), {}};
    }
    result += "\n";
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
  std::string anyFile() {
    const std::string bundle = anyBundle();
    switch (below(3)) {
      case 0:
        return bundle + "/Info.plist";
      case 1:
        return bundle + "/Resources/German/ServicesMenu.strings";
      default:
        return any(bundle + "/");
    }
  }
  /// Also notes those that links lead from here to there: any of them may.
  void touchLinks() {
    for (const auto& entry : fs::directory_iterator(root)) {
      if (entry.is_symlink() || fs::exists(fs::symlink_status(entry.path() / "shared.plist")) ||
          fs::exists(entry.path() / "hard.plist")) {
        touched.insert(entry.path());
      }
    }
  }
  void move(const std::string& from, const std::string& to) { ::rename(from.c_str(), to.c_str()); }

  void write() {
    const std::string file = anyFile();
    if (fs::is_symlink(file) || fs::path(file).filename() == "hard.plist") touchLinks();
    const int descriptor = open(file.c_str(), O_WRONLY | O_CLOEXEC);
    if (descriptor >= 0 && pwrite(descriptor, text().data(), 8, 0) < 0) perror("pwrite");
    close(descriptor);
  }
  void create() { put(anyBundle() + "/file" + std::to_string(below(3)), text()); }
  void truncate() {
    const std::string file = anyFile();
    if (::truncate(file.c_str(), below(9)) == 0) touchLinks();
  }
  void renameWithin() {
    const std::string file = anyFile();
    move(file, file + std::to_string(below(3)));
  }
  void moveFileOut() { move(anyFile(), outside_ + "kept"); }
  void moveFileIn() { move(outside_ + "kept", anyBundle() + "/Info.plist"); }
  void replace() {
    put(outside_ + "new", text());
    move(outside_ + "new", anyBundle() + "/Info.plist");
  }
  void removeFile() { unlink(anyFile().c_str()); }
  void changeMode() {
    chmod(anyFile().c_str(), below(2) ? 0600 : 0644);
    touchLinks();
  }
  void retarget() {
    const std::string path = root + "linked.service";
    touched.insert(path);
    std::error_code ignored;
    fs::remove_all(path, ignored);
    link(outside_ + "target" + std::to_string(below(4)), path);
  }
  void writeBehindLink() {
    touchLinks();
    put(any(outside_ + "target" + std::to_string(below(3)) + "/"), text());
  }
  void swapDirectories() {
    const std::string one = anyBundle(), other = anyBundle();
    renameat2(AT_FDCWD, one.c_str(), AT_FDCWD, other.c_str(), RENAME_EXCHANGE);
  }
  void setOldTimes() {
    const timespec times[2] = {{1'000'000'000, 0}, {1'000'000'000, 0}};
    utimensat(AT_FDCWD, anyFile().c_str(), times, 0);
    touchLinks();
  }
  void addBundle() {
    const std::string bundle = root + bundleName(below(6));
    touched.insert(bundle);
    makeBundle(bundle);
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
    fs::create_directories(anyBundle() + "/Resources/French/deep", ignored);
  }

  static void waitForAnotherTick() {
    const std::int64_t start = timeStampNow();
    while (timeStampNow() < start + 25'000'000) std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }

  const std::string outside_;
  std::mt19937 random_;
};

/// A journal that is stopped, killed, started and asked as the server does.
class Server {
 public:
  Server(const Scratch& scratch, const std::string& root, bool live) : scratch_(scratch) {
    options_.directory = scratch / "state";
    options_.limits.live = live;
    options_.now = [this] { return timeStampNow() + clockStep; };
    root_ = root;
    start();
  }

  void start() {
    journal_.emplace(options_, files_, log, pool_);
    journal_->watch({root_});
    journal_->start([](JournalForest::Hints) {});
  }
  void stop() { journal_.reset(); }

  /// Loses what was written last, as a process does that is killed before it writes.
  void kill() {
    const std::string index = scratch_.read("state/journal");
    stop();
    scratch_.write("state/journal", index);
    start();
  }

  struct Answer {
    std::set<std::string> bundles;
    bool mustScan = false;
    bool listed = false;
  };

  /// What the next update would find changed, of these bundles.
  Answer ask(const std::string& root, const std::set<std::string>& bundles) {
    KELPathChangesObserver observer(*journal_, clock_, position_);
    position_ = journal_->currentEventID();
    observer.observeChangesUnderPaths({root});
    Answer answer;
    answer.mustScan = observer.changedPathsUnderPath(root).contains(root);
    answer.listed = answer.mustScan || observer.changedPathsUnderPath(root).contains(root + ".");
    for (const std::string& bundle : bundles) {
      if (observer.pathChangedOrRequiresRescan(bundle) || !observer.changedPathsUnderPath(bundle).empty()) {
        answer.bundles.insert(bundle);
      }
    }
    return answer;
  }

  test::RecordingLog log;
  std::int64_t clockStep = 0;  // set only while nothing runs
  EventID position() const { return position_; }

 private:
  const Scratch& scratch_;
  LinuxFileSystem files_{log};
  LinuxClock clock_;
  ConcurrentQueue pool_;
  JournalOptions options_;
  std::string root_;
  std::optional<LinuxEventJournal> journal_;
  EventID position_ = 0;
};

struct Tally {
  std::size_t operations = 0;
  std::size_t asked = 0;
  std::size_t needless = 0;
};

std::set<std::string> bundlesOf(const std::map<std::string, std::string>& one,
                                const std::map<std::string, std::string>& other) {
  std::set<std::string> names;
  for (const auto* snapshot : {&one, &other}) {
    for (const auto& [bundle, state] : *snapshot) names.insert(bundle);
  }
  return names;
}

void expectTold(const std::map<std::string, std::string>& before,
                const std::map<std::string, std::string>& now, const Server::Answer& answer) {
  bool namesDiffer = false;
  for (const std::string& bundle : bundlesOf(before, now)) {
    namesDiffer |= before.contains(bundle) != now.contains(bundle);
    const bool same = before.contains(bundle) && now.contains(bundle) && before.at(bundle) == now.at(bundle);
    EXPECT_TRUE(same || answer.bundles.contains(bundle)) << bundle;
  }
  EXPECT_TRUE(answer.listed || !namesDiffer);
}

void runHistory(unsigned seed, bool live, Tally& tally) {
  SCOPED_TRACE("seed " + std::to_string(seed) + (live ? ", live" : ", by comparison"));
  const Scratch scratch;
  Disk disk(scratch, seed);
  Server server(scratch, disk.root, live);
  server.ask(disk.root, {});
  for (int round = 0; round < 8 && !testing::Test::HasFailure(); ++round) {
    auto before = disk.snapshot();
    disk.touched.clear();
    const EventID position = server.position();
    bool killed = false;
    for (unsigned left = disk.below(7); left > 0; --left, ++tally.operations) {
      disk.operate();
      const unsigned happens = disk.below(24);
      if (happens < 3) {
        server.stop();
        if (happens == 1) {
          server.clockStep -= 3'600'000'000'000;
          disk.operate();
        }
        if (happens == 2) server.clockStep += 60'000'000'000;
        server.start();
      } else if (happens == 3) {
        killed = true;
        server.kill();
      } else if (happens == 4) {
        disk.replaceRoot();
      }
    }
    auto now = disk.snapshot();
    const Server::Answer answer = server.ask(disk.root, bundlesOf(before, now));
    EXPECT_GT(server.position(), position);
    expectTold(before, now, answer);
    if (answer.mustScan || killed) continue;
    tally.asked += now.size();
    for (const std::string& bundle : answer.bundles) {
      tally.needless += !disk.touched.contains(bundle) && before[bundle] == now[bundle];
    }
  }
}

class EventJournalHistories : public testing::TestWithParam<bool> {};
INSTANTIATE_TEST_SUITE_P(LiveOrNot, EventJournalHistories, testing::Bool());

TEST_P(EventJournalHistories, EveryBundleThatDiffersIsToldAndHardlyAnyOther) {
  Tally tally;
  unsigned seed = 1;
  for (; tally.operations < 5'000 && !HasFailure(); ++seed) runHistory(seed, GetParam(), tally);
  EXPECT_LE(tally.needless * 100, tally.asked) << tally.needless << " of " << tally.asked;
  RecordProperty("histories", static_cast<int>(seed));
}

TEST_P(EventJournalHistories, WhatRacesWithAQuestionIsToldNowOrNextTime) {
  for (unsigned seed = 1; seed <= 40 && !HasFailure(); ++seed) {
    SCOPED_TRACE(seed);
    const Scratch scratch;
    Disk disk(scratch, seed);
    Server server(scratch, disk.root, GetParam());
    server.ask(disk.root, {});
    const auto before = disk.snapshot();
    std::set<std::string> told;
    bool listed = false;
    const auto ask = [&](const std::set<std::string>& bundles) {
      const Server::Answer answer = server.ask(disk.root, bundles);
      told.insert(answer.bundles.begin(), answer.bundles.end());
      listed |= answer.listed;
    };
    std::set<std::string> bundles = bundlesOf(before, {});
    for (int index = 0; index < 6; ++index)
      bundles.insert(disk.root + "b" + std::to_string(index) + ".service");
    {
      std::jthread operations([&disk] {
        for (int count = 0; count < 25; ++count) disk.operate();
      });
      for (int count = 0; count < 8; ++count) ask(bundles);
    }
    const auto now = disk.snapshot();
    bundles.merge(bundlesOf(before, now));
    ask(bundles);
    expectTold(before, now, {told, false, listed});
  }
}

}  // namespace
}  // namespace kel::platform
