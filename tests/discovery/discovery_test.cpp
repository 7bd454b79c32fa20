#include <gmock/gmock.h>
#include <thread>

#include "discovery/bundle_paths.h"
#include "discovery/path_change_observation_request.h"
#include "discovery/path_changes_observer.h"
#include "discovery/services_provider_locator.h"
#include "support/debug_lines.h"
#include "support/in_memory_platform.h"

namespace kel {
namespace {

using namespace testing;
using test::debugLines;
using Paths = std::vector<std::string>;

constexpr std::uint32_t mustScan = platform::event_flags::mustScanSubDirectories;
constexpr std::uint32_t wrapped = platform::event_flags::eventIDsWrapped;

TEST(ServicesProviderLocatorTest, ListsOnceKeepsVisibleEntriesOfEveryKindAndMissingDirectoriesAsEmpty) {
  test::InMemoryFileSystem files;
  test::RecordingLog log;
  for (const std::string name : {"x.service/Info.plist", ".hidden", "notes.txt"})
    files.addText("/A/Services/" + name, "");
  for (const std::string base : {"/A/Services/", "/A/Services"}) {
    KELServicesProviderLocator locator(files, log, base);
    EXPECT_EQ(debugLines([&] { locator.refreshCache(); }), "Scanning directory: " + base);
    EXPECT_THAT(locator.paths(), ElementsAre("/A/Services/notes.txt", "/A/Services/x.service"));
    files.addText("/A/Services/later.service", "");
    EXPECT_EQ(debugLines([&] { locator.refreshCache(); }), "Cache valid for directory " + base);
    EXPECT_THAT(locator.paths(), testing::SizeIs(2)) << "a valid listing was read again";
    files.removeTree("/A/Services/later.service");
  }
  KELServicesProviderLocator missing(files, log, "/none/");
  missing.paths().insert("/none/restored");
  files.setFailing({"/none"});
  for (int attempt = 0; attempt < 2; ++attempt) missing.refreshCache();
  EXPECT_TRUE(missing.isUnsettled() && !missing.directoryContentsCacheIsValid());
  EXPECT_THAT(missing.paths(), testing::SizeIs(1))
      << "a listing that failed for now replaced one that did not";
  EXPECT_THAT(log.take(), testing::SizeIs(1));
  files.setFailing({});
  EXPECT_EQ(debugLines([&] { missing.refreshCache(); }), "Scanning directory: /none/");
  EXPECT_THAT(missing.paths(), IsEmpty());
  EXPECT_TRUE(missing.directoryContentsCacheIsValid());
}

TEST(PathsToObserveTest, ThreeNeighboursAreWatchedThroughTheirDirectoryAndNothingTwice) {
  for (const auto& [paths, expected] : std::vector<std::pair<Paths, Paths>>{
           {{}, {}},
           {{"/A/x.app", "/A/x.app/in.app"}, {"/A/x.app", "/A/x.app/in.app"}},
           {{"/A/x.app", "/A/y.app", "/A/z.app", "/A/B/w.app"}, {"/A/"}},
           {{"/x", "/y", "/z", "/A/w.app"}, {"/"}}})
    EXPECT_THAT(paths_to_observe(paths), UnorderedElementsAreArray(expected));
  for (const auto& [path, parent] : std::vector<std::pair<std::string, std::string>>{
           {"/A/x.app", "/A/"}, {"/A/", "/"}, {"/A/B/", "/A/"}, {"/", "/"}, {"x", "/"}, {"", "/"}})
    EXPECT_EQ(parent_directory(path), parent) << path;
}

struct PathChangesObserverTest : testing::Test {
  /// Observes and returns the debug lines; afterwards no stream is open.
  std::string observe(const Paths& paths) {
    std::string lines = debugLines([&] { observer.observeChangesUnderPaths(paths); });
    EXPECT_EQ(journal.liveStreams, 0) << "a stream outlived its request";
    return lines;
  }

  test::InMemoryJournal journal;
  test::ManualClock clock;
  KELPathChangesObserver observer{journal, clock, journal.currentEventID()};
};

TEST_F(PathChangesObserverTest, ChangesInsideADirectoryAreUnderItAndLeaveItselfUnchanged) {
  journal.record("/A/Services/x.service/");
  EXPECT_EQ(observe({"/A/Services/"}),
            "Looking for changes under paths:\n\t/A/Services/\nChanged subpaths:\n\t/A/Services/x.service/");
  EXPECT_FALSE(observer.pathChangedOrRequiresRescan("/A/Services/"));
  EXPECT_TRUE(observer.pathChangedOrRequiresRescan("/A/Services/x.service/Info.plist"));
  EXPECT_THAT(observer.changedPathsUnderPath("/A/Services/"), ElementsAre("/A/Services/x.service/"));
  EXPECT_THAT(observer.changedPathsUnderPath("/A/Services/y.service"), IsEmpty());
  EXPECT_TRUE(journal.creations.at(0).since == 1000 && journal.creations.at(0).flags == 5);
}

TEST_F(PathChangesObserverTest, WhatAnEarlierCallCoveredIsNotAskedAgain) {
  EXPECT_EQ(observe({}), "");
  EXPECT_EQ(observe({"/A/Services/x.service"}),
            "Looking for changes under paths:\n\t/A/Services/x.service\nNo changes!");
  EXPECT_EQ(observe({"/A/Services/", "/A/Services/x.service"}),
            "Looking for changes under paths:\n\t/A/Services/\nNo changes!");
  EXPECT_EQ(observe({"/A/Services/x.service", "/A/Services/y.service"}), "");
  EXPECT_EQ(journal.creations.size(), 2U);
}

TEST_F(PathChangesObserverTest, AFullScanNeedCountsForThePathsAskedAndNotForThoseTheEventsName) {
  for (const std::uint32_t flags : {mustScan, wrapped, mustScan | wrapped}) {
    SCOPED_TRACE(flags);
    test::InMemoryJournal ownJournal;
    KELPathChangesObserver own(ownJournal, clock, 1000);
    ownJournal.record("/A/Services/z", flags);
    ownJournal.record("/A/Services/y");
    EXPECT_EQ(debugLines([&] { own.observeChangesUnderPaths({"/A/Services/"}); }),
              "Looking for changes under paths:\n\t/A/Services/\nVigil says we must do a full scan");
    EXPECT_TRUE(own.pathChangedOrRequiresRescan("/A/Services/q"));
    EXPECT_THAT(own.changedPathsUnderPath("/A/"), ElementsAre("/A/Services/"));
    EXPECT_THAT(own.changedPathsUnderPath("/A/Services/"), ElementsAre("/A/Services/"));
    EXPECT_THAT(own.changedPathsUnderPath("/A/Services/y"), IsEmpty());
  }
}

TEST_F(PathChangesObserverTest, ARootThatCannotBeWatchedDoesNotMatterAndWithoutAStreamAllNeedsAFullScan) {
  journal.refuseWatchRoot = true;
  EXPECT_EQ(observe({"/C/"}), "Looking for changes under paths:\n\t/C/\nNo changes!");
  EXPECT_EQ(journal.creations.at(1).flags, 1U);
  journal.available = false;
  EXPECT_EQ(observe({"/A/"}), "Looking for changes under paths:\n\t/A/\nVigilStream failed!");
  journal.available = journal.refuseStart = true;
  EXPECT_EQ(observe({"/B/"}), "Looking for changes under paths:\n\t/B/\nVigilStream failed!");
  EXPECT_TRUE(observer.pathChangedOrRequiresRescan("/A/x") && observer.pathChangedOrRequiresRescan("/B/"));
  EXPECT_EQ(observe({"/A/x"}), "") << "a path in need of a scan counts as observed";
}

TEST_F(PathChangesObserverTest, AReplayThatTakesTooLongSaysNothingAboutItsPaths) {
  journal.historyEnds = false;
  journal.record("/A/x");
  std::string lines;
  std::thread observing([&] { lines = observe({"/A/"}); });
  ASSERT_TRUE(clock.awaitWaits(1));
  clock.advance(std::chrono::seconds(15) - std::chrono::nanoseconds(1));
  ASSERT_TRUE(clock.awaitWaits(1)) << "gave up before 15 seconds";
  clock.advance(std::chrono::nanoseconds(1));
  observing.join();
  EXPECT_EQ(lines, "Looking for changes under paths:\n\t/A/\nVigil didn't finish after 15 seconds!");
  EXPECT_FALSE(observer.pathChangedOrRequiresRescan("/A/x"));
  EXPECT_THAT(observer.changedPathsUnderPath("/A/"), IsEmpty());
  EXPECT_EQ(observe({"/A/x"}), "") << "the paths count as observed";
}

}  // namespace
}  // namespace kel
