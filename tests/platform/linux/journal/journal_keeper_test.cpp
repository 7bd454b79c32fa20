#include "platform/linux/journal/journal_keeper.h"

#include <fcntl.h>
#include <stdio.h>
#include <thread>

#include "platform/linux/scratch.h"

namespace kel::platform {
namespace {

namespace fs = std::filesystem;

class JournalKeeperTest : public ScratchTest {
 protected:
  void open() {
    keeper.emplace(std::vector<WatchedRoot>{{root + "/", false}}, options, files, log, pool);
    keeper->open();
  }

  /// The paths told since `position`, separated by blanks; "!" where it cannot be told.
  std::string told() {
    std::string result;
    for (const JournalEvent& event : keeper->eventsSince(position, {root + "/"}, true)) {
      result += event.flags ? "!" : event.path.substr(root.size()) + " ";
    }
    return result;
  }

  void exchange() const { renameat2(AT_FDCWD, root.c_str(), AT_FDCWD, other.c_str(), RENAME_EXCHANGE); }

  const std::string root = scratch.makeDirectory("root");
  const std::string other = scratch.makeDirectory("other");
  JournalOptions options;
  ConcurrentQueue pool;
  std::optional<JournalKeeper> keeper;
  EventID position = 0;
};

TEST_F(JournalKeeperTest, WhatWasLookedAtWhileTheRootWasAnotherIsNotTakenForTheRoots) {
  for (int index = 0; index < 100; ++index) {
    scratch.write("root/" + std::to_string(index) + "/file");
    scratch.write("other/" + std::to_string(index) + "/file");
  }
  for (int round = 0; round < 8; ++round) {
    open();
    {
      const std::jthread exchanging([this](const std::stop_token& stop) {
        while (!stop.stop_requested()) {
          exchange();
          exchange();
        }
      });
      keeper->currentEventID();
    }
    position = keeper->currentEventID();
    for (int index = 0; index < 100; ++index) scratch.write("root/" + std::to_string(index) + "/file", "new");
    const std::string events = told();
    for (int index = 0; index < 100; ++index) {
      EXPECT_THAT(events, testing::HasSubstr("/" + std::to_string(index) + "/file "));
    }
  }
}

TEST_F(JournalKeeperTest, WhatALookRecordsWhileEventsAreLostIsNotTakenForTold) {
  scratch.write("root/bundle/file", "before");
  open();
  position = keeper->currentEventID();
  for (int count = 0; count < 20'000; ++count) scratch.write(count % 2 ? "root/one" : "root/two");
  scratch.write("root/bundle/file", "behind");
  keeper->forest().questionUnsettled();
  keeper->forest().lookAtSome({keeper->forest().trees()[0].get()}, JournalForest::LookMode::ForGood,
                              std::chrono::steady_clock::time_point::max());
  EXPECT_EQ(told(), "!");
}

TEST_F(JournalKeeperTest, WhatIsAsBeforeTheIndexIsNotTakenForWhatAPositionSaw) {
  options.directory = scratch / "state";
  for (const bool toldMore : {false, true}) {
    open();
    keeper->currentEventID();
    ASSERT_FALSE(files.writeAtomically(keeper->indexPath(), keeper->indexFile()));
    if (toldMore) exchange();
    position = keeper->currentEventID();
    if (toldMore) exchange();
    open();
    EXPECT_EQ(told(), toldMore ? "!" : "");
  }
}

TEST_F(JournalKeeperTest, ALinkWhoseTargetOutgrowsTheLimitIsToldAtOnceAndIsFollowedAgainByTheNextProcess) {
  options.directory = scratch / "state";
  options.limits.mostBehindLink = 10;
  scratch.write("target/file");
  fs::create_directory_symlink(scratch / "target", root + "/link");
  open();
  position = keeper->currentEventID();
  for (int index = 0; index < 20; ++index) scratch.write("target/" + std::to_string(index));
  EXPECT_EQ(told(), "/link/ ");
  for (int index = 0; index < 20; ++index) fs::remove(scratch / "target/" + std::to_string(index));
  ASSERT_FALSE(files.writeAtomically(keeper->indexPath(), keeper->indexFile()));
  open();
  keeper->currentEventID();
  position = keeper->currentEventID();
  EXPECT_EQ(told(), "");
}

TEST_F(JournalKeeperTest, WhatCanNeverBeToldIsToldWhenAskedButNotWrittenAgainAndAgain) {
  fs::create_directory_symlink("/", root + "/everything");
  open();
  position = keeper->currentEventID();
  EXPECT_EQ(told(), "/everything/ ");
  keeper->indexFile();
  keeper->questionUncovered();
  while (keeper->lookInBackground()) {
  }
  EXPECT_FALSE(keeper->needsSaving());
  EXPECT_EQ(told(), "/everything/ ");
}

TEST_F(JournalKeeperTest, ADirectoryThatGrowsBeyondTheLimitIsNotRemembered) {
  options.limits.mostEntries = 100;
  options.limits.mostVanished = 10;
  open();
  position = keeper->currentEventID();
  for (int index = 0; index < 500; ++index) scratch.write("root/" + std::to_string(index));
  EXPECT_EQ(told(), "!");
  EXPECT_LE(keeper->forest().trees()[0]->nodeCount, 100u);
  for (int index = 0; index < 500; ++index) fs::remove(root + "/" + std::to_string(index));
  keeper->currentEventID();
  position = keeper->currentEventID();
  scratch.write("root/file");
  EXPECT_EQ(told(), "/file /. ");
}

}  // namespace
}  // namespace kel::platform
