#include "platform/linux/journal/linux_event_journal.h"

#include <future>
#include <stdlib.h>
#include <sys/stat.h>

#include "platform/linux/scratch.h"

namespace kel::platform {
namespace {

namespace fs = std::filesystem;
using testing::Contains;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::UnorderedElementsAre;

/// Live or by comparison.
class EventJournalTest : public ScratchTest, public testing::WithParamInterface<bool> {
 protected:
  EventJournalTest() {
    options.directory = scratch / "state";
    options.limits.live = GetParam();
    fs::create_directories(root);
  }

  LinuxEventJournal& journal() {
    if (!journal_) {
      journal_.emplace(options, files, log, pool_);
      journal_->watch({root});
      if (changed) journal_->start(changed);
    }
    return *journal_;
  }
  void restart() { journal_.reset(); }

  void bundle(const std::string& name) { scratch.write("Services/" + name + "/Info.plist", "declared"); }

  /// What is delivered up to history done: paths below the root, then the flags of what is no plain event.
  std::vector<std::string> replay(EventID since, std::vector<std::string> paths = {},
                                  std::uint32_t flags = stream_flags::watchRoot) {
    if (paths.empty()) paths = {root};
    std::vector<std::string> told;
    std::promise<void> done;
    SerialQueue queue("replay");
    const auto stream = journal().createStream(
        [&](const std::vector<JournalEvent>& events) {
          for (const JournalEvent& event : events) {
            const bool isBelow = event.flags == 0 && event.path.starts_with(root);
            if (event.flags == event_flags::historyDone) return done.set_value();
            told.push_back(isBelow ? event.path.substr(root.size()) : std::to_string(event.flags));
          }
        },
        paths, since, {}, flags);
    stream->setQueue(queue);
    EXPECT_TRUE(stream->start());
    EXPECT_EQ(done.get_future().wait_for(std::chrono::seconds(30)), std::future_status::ready);
    queue.sync([&] {
      stream->stop();
      stream->invalidate();
    });
    return told;
  }

  const std::string root = scratch / "Services/";
  const std::string mustScan = "1", wrapped = "8";
  JournalOptions options;
  LinuxEventJournal::ChangeHandler changed;

 private:
  ConcurrentQueue pool_;
  std::optional<LinuxEventJournal> journal_;
};

INSTANTIATE_TEST_SUITE_P(LiveOrNot, EventJournalTest, testing::Bool());

TEST_P(EventJournalTest, EventsNameTheEntryThatChanged) {
  for (int index = 0; index < 1000; ++index) bundle(std::to_string(index) + ".service");
  const EventID start = journal().currentEventID();
  EXPECT_THAT(replay(start), IsEmpty());

  bundle("new.service");
  EXPECT_THAT(replay(start), UnorderedElementsAre(".", "new.service/"));
  const EventID added = journal().currentEventID();
  scratch.write("Services/7.service/Info.plist", "DECLARED");
  EXPECT_THAT(replay(added), ElementsAre("7.service/Info.plist"));
  const EventID written = journal().currentEventID();
  fs::remove_all(root + "8.service");
  fs::rename(root + "9.service", root + "other.service");
  EXPECT_THAT(replay(written), UnorderedElementsAre(".", "8.service/", "9.service/", "other.service/"));
  EXPECT_THAT(replay(written, {root + "8.service"}), ElementsAre("8.service/"));
  EXPECT_THAT(replay(start), testing::IsSupersetOf({"new.service/", "7.service/Info.plist", "9.service/"}));

  const EventID last = journal().currentEventID();
  restart();
  EXPECT_GT(journal().currentEventID(), last);
  EXPECT_THAT(replay(last), IsEmpty());
}

TEST_P(EventJournalTest, WhatCannotBeToldIsFlagged) {
  bundle("a.service");
  const EventID start = journal().currentEventID();
  EXPECT_THAT(replay(start, {scratch / "elsewhere/"}), ElementsAre(mustScan));
  EXPECT_THAT(replay(start + 1'000'000'000'000'000), ElementsAre(wrapped));
  EXPECT_THAT(replay(1), ElementsAre(mustScan));
  fs::rename(root, scratch / "moved");
  bundle("a.service");
  EXPECT_THAT(replay(start), ElementsAre(""));  // the root itself
  EXPECT_THAT(replay(start, {}, 0), ElementsAre(mustScan));

  const EventID before = journal().currentEventID();
  restart();
  std::string index = scratch.read("state/journal");
  index.back() ^= 1;
  scratch.write("state/journal", index);
  EXPECT_THAT(replay(before), ElementsAre(mustScan));
  EXPECT_THAT(log.take(), ElementsAre(testing::HasSubstr("damaged")));
}

TEST_P(EventJournalTest, ARootThatComesAndGoesIsToldAsItself) {
  fs::remove_all(scratch / "Services");
  const EventID start = journal().currentEventID();
  EXPECT_THAT(replay(start), IsEmpty());
  bundle("a.service");
  EXPECT_THAT(replay(start), ElementsAre(""));
  const EventID there = journal().currentEventID();
  fs::rename(scratch / "Services", scratch / "elsewhere");
  fs::create_directory_symlink(scratch / "elsewhere", scratch / "Services");
  EXPECT_THAT(replay(there), testing::Not(Contains("")));  // the same directory, by another way
  scratch.write("elsewhere/a.service/Info.plist", "another");
  EXPECT_THAT(replay(there), Contains("a.service/Info.plist"));
  fs::remove(scratch / "Services");
  EXPECT_THAT(replay(there), Contains(""));
}

TEST_P(EventJournalTest, HostileTreesCostABoundedLook) {
  bundle("a.service");
  bundle("b.service");
  fs::create_directory_symlink("/", root + "a.service/everything");
  fs::create_directory_symlink("..", root + "a.service/loop");
  fs::create_symlink("self", root + "a.service/self");
  ASSERT_EQ(mkfifo((root + "a.service/fifo").c_str(), 0600), 0);
  scratch.write("Services/b.service/\xff\xfe", "no UTF-8");
  const EventID start = journal().currentEventID();
  scratch.write("Services/b.service/\xff\xfe", "nor this");
  EXPECT_THAT(replay(start, {root + "b.service"}), ElementsAre("b.service/."));
  EXPECT_THAT(replay(start), Contains("a.service/everything/"));  // more than is worth looking at
  EXPECT_THAT(log.take(), ElementsAre(testing::HasSubstr("leads to too much")));
}

TEST_P(EventJournalTest, ADirectoryOfAHundredThousandEntriesOnAnotherFileSystemBehindALink) {
  std::string elsewhere = "/dev/shm/kel-test-XXXXXX";
  if (!mkdtemp(elsewhere.data())) GTEST_SKIP() << "no second file system";
  for (int index = 0; index < 100'000; ++index) std::ofstream(elsewhere + "/" + std::to_string(index));
  fs::remove(scratch / "Services");
  fs::create_directory_symlink(elsewhere, scratch / "Services");
  const EventID start = journal().currentEventID();
  std::ofstream(elsewhere + "/500") << "changed";
  EXPECT_THAT(replay(start), ElementsAre("500"));
  EXPECT_THAT(log.messages(), IsEmpty());
  fs::remove_all(elsewhere);
}

TEST_P(EventJournalTest, BeyondTheLimitsTheTruthIsFoundByLooking) {
  options.limits.mostWatches = 2;
  for (int index = 0; index < 1200; ++index) bundle(std::to_string(index) + ".service");
  const EventID start = journal().currentEventID();
  scratch.write("Services/1100.service/Info.plist", "DECLARED");
  EXPECT_THAT(replay(start), ElementsAre("1100.service/Info.plist"));
  EXPECT_EQ(log.take().size(), GetParam() ? 1u : 0u);

  restart();
  options.limits.mostEntries = 100;
  EXPECT_THAT(replay(start), ElementsAre(mustScan));
  restart();
  options.limits.mostEntries = 100'000;
  options.longestLook = std::chrono::milliseconds(0);
  EXPECT_THAT(replay(start), ElementsAre(mustScan));
}

class LiveEventJournalTest : public EventJournalTest {};
INSTANTIATE_TEST_SUITE_P(Live, LiveEventJournalTest, testing::Values(true));

TEST_P(LiveEventJournalTest, AnOverflowOfTheEventQueueIsMadeUpFor) {
  std::promise<void> entered, released;
  std::atomic<bool> isFirst = true;
  changed = [&](JournalForest::Hints) {
    if (!isFirst.exchange(false)) return;
    entered.set_value();
    released.get_future().wait();
  };
  bundle("a.service");
  const EventID start = journal().currentEventID();
  bundle("b.service");
  entered.get_future().wait();  // the journal's thread is held here
  for (int index = 0; index < 20'000; ++index) {
    fs::rename(root + "a.service", root + "c.service");
    fs::rename(root + "c.service", root + "a.service");
  }
  scratch.write("Services/a.service/Info.plist", "DECLARED");
  bundle("d.service");
  released.set_value();
  EXPECT_THAT(replay(start), ElementsAre(mustScan));
  EXPECT_THAT(log.take(), ElementsAre(testing::HasSubstr("faster than they could be told")));
  const EventID later = journal().currentEventID();
  scratch.write("Services/d.service/Info.plist", "DECLARED");
  EXPECT_THAT(replay(later), ElementsAre("d.service/Info.plist"));
}

}  // namespace
}  // namespace kel::platform
