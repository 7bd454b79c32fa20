#include "platform/linux/registry/linux_application_registry.h"

#include <fcntl.h>
#include <thread>

#include "platform/linux/scratch.h"
#include "support/in_memory_files.h"

namespace kel::platform {
namespace {

using testing::ElementsAre;

constexpr auto with = "{ QVServices = ({}); }", without = "{ QVServices = (  ); }";
constexpr auto database = "/state/kel/applications";

/// Information dictionaries are on the disk, the database is in memory.
struct CountingFiles final : test::InMemoryFileSystem {
  FileReading read(const std::string& path, std::size_t largest) override {
    if (path == database) return InMemoryFileSystem::read(path, largest);
    auto bytes = readFile(AT_FDCWD, path, largest);
    if (++reads == 1 && onFirstRead) onFirstRead();
    return {std::move(bytes), {}};
  }
  std::atomic<int> reads = 0;
  std::function<void()> onFirstRead;
};

struct TestChangeLog final : ChangeLog {
  EventID currentEventID() override { return 7; }
  bool changedSince(const std::vector<std::string>&, EventID) override { return changed.exchange(false); }
  std::atomic<bool> changed = false;
};

struct LinuxApplicationRegistryTest : ScratchTest {
  auto makeRegistry(ChangeLog* changeLog = nullptr) {
    std::vector<std::string> roots = {scratch / "a/"};
    return std::make_unique<LinuxApplicationRegistry>(counted, log, queue, roots, "/state", changeLog);
  }
  std::vector<std::string> providers(LinuxApplicationRegistry& registry) {
    std::vector<std::string> names;
    counted.reads = 0;
    counted.forgetUses();
    for (const auto& each : registry.applications(~0U, ApplicationRegistry::providesServices).applications)
      names.push_back(std::filesystem::path(*each.path).stem());
    return names;
  }
  void settle(LinuxApplicationRegistry& registry) {
    do providers(registry);
    while (counted.reads > 0);
  }
  void write(const std::string& name, const char* text) { scratch.write(name + ".app/Info.plist", text); }

  CountingFiles counted;
  TestChangeLog changes;
  ConcurrentQueue queue;
};

TEST_F(LinuxApplicationRegistryTest, OnlyWhatChangedIsReadAndWrittenAlsoAfterARestart) {
  write("a/Same", with);
  write("a/f/Changed", without);
  scratch.makeDirectory("a/New.app");
  settle(*makeRegistry());
  EXPECT_THAT(providers(*makeRegistry()), ElementsAre("Same"));
  EXPECT_EQ(counted.reads, 0);
  EXPECT_EQ(counted.uses(database), 2u) << "not only tested and read";
  for (const char* name : {"a/f/Changed", "a/New"}) write(name, with);
  EXPECT_THAT(providers(*makeRegistry()), ElementsAre("New", "Same", "Changed"));
  EXPECT_EQ(counted.reads, 2);
}

TEST_F(LinuxApplicationRegistryTest, FileIsNotRememberedBeforeItsNextChangeMustShow) {
  const auto start = std::chrono::steady_clock::now();
  write("a/A", with);
  settle(*makeRegistry());
  EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(10));
  constexpr std::int64_t now = 10'000'000'000;
  for (const std::int64_t racy : {9'980'000'001, 7'910'000'000, 11'000'000'005})
    EXPECT_TRUE(isRacy(racy, now, TimeStamps::Local)) << racy;
  for (const std::int64_t settled : {9'979'999'999, 7'900'000'000, -9'999'999'995})
    EXPECT_FALSE(isRacy(settled, now, TimeStamps::Local)) << settled;
}

TEST_F(LinuxApplicationRegistryTest, DamagedDatabaseIsRefusedWholeAndReplaced) {
  write("a/A", with);
  settle(*makeRegistry());
  const Bytes whole = counted.contents(database).value();
  for (std::size_t i = 0; i < whole.size(); ++i) {
    Bytes changed = whole;
    changed[i] ^= 1;
    EXPECT_FALSE(decodeApplications(changed)) << i;
  }
  counted.addFile(database, Bytes(whole.begin(), whole.end() - 1));
  EXPECT_THAT(providers(*makeRegistry()), ElementsAre("A"));
  EXPECT_THAT(log.take(),
              ElementsAre(testing::EndsWith(" /state/kel/applications: damaged or of another version")));
  EXPECT_EQ(counted.contents(database), whole);
}

TEST_F(LinuxApplicationRegistryTest, QueryDuringSeedingWaitsForItsScan) {
  write("a/A", with);
  settle(*makeRegistry());
  counted.remove(database);
  Semaphore done;
  std::thread query;
  const auto registry = makeRegistry(&changes);
  counted.onFirstRead = [&] { query = std::thread([&] { registry->applications(0, 0); }); };
  registry->seed([&] {
    registry->applications(0, 0);
    done.signal();
  });
  ASSERT_TRUE(done.wait(std::chrono::seconds(20)));
  query.join();
  EXPECT_EQ(counted.reads, 1);
}

TEST_F(LinuxApplicationRegistryTest, AnswersFromMemoryWhileNothingChangedBelowTheRootsOrBehindLinks) {
  write("x/Target", without);
  scratch.makeDirectory("a");
  symlink("../x/Target.app", (scratch / "a/Link.app").c_str());
  symlink("nowhere", (scratch / "a/Dead.app").c_str());
  const auto registry = makeRegistry(&changes);
  settle(*registry);
  write("a/B", with);
  EXPECT_THAT(providers(*registry), ElementsAre()) << "the disk was looked at";
  write("x/Target", with);
  EXPECT_THAT(providers(*registry), ElementsAre("B", "Link"));
  settle(*registry);
  write("a/B", "()");
  counted.onFirstRead = [&] { write("a/B", with); };
  changes.changed = true;
  providers(*registry);
  EXPECT_EQ(providers(*registry).size(), 2u) << "what was read while it changed was kept";
}

}  // namespace
}  // namespace kel::platform
