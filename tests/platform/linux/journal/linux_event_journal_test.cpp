#include "platform/linux/journal/linux_event_journal.h"

#include <fcntl.h>
#include <future>
#include <stdio.h>
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
    options.limits.home = scratch.path();
    options.limits.mayWatch = [this] { return hasInstance.load(); };
    options.betweenSavings = std::chrono::milliseconds(0);
    hasInstance = GetParam();
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
  JournalService& service() { return *journal().service(); }

  /// The position of now, with which everything that can be known is.
  EventID position() {
    service().save();
    return journal().currentEventID();
  }
  void kill() { journal_.reset(); }
  void restart() {
    service().save();
    kill();
  }

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
    queue.sync([&] { stream->stop(), stream->invalidate(); });
    return told;
  }

  const std::string root = scratch / "Services/";
  const std::string mustScan = "1", wrapped = "8";
  std::atomic<bool> hasInstance = true;
  JournalOptions options;
  LinuxEventJournal::ChangeHandler changed;

 private:
  ConcurrentQueue pool_;
  std::optional<LinuxEventJournal> journal_;
};

INSTANTIATE_TEST_SUITE_P(LiveOrNot, EventJournalTest, testing::Bool());

TEST_P(EventJournalTest, EventsNameTheEntryThatChanged) {
  for (int index = 0; index < 100; ++index) bundle(std::to_string(index) + ".service");
  const EventID start = position();
  EXPECT_THAT(replay(start), IsEmpty());

  bundle("new.service");
  EXPECT_THAT(replay(start), UnorderedElementsAre(".", "new.service/"));
  const EventID added = position();
  scratch.write("Services/7.service/Info.plist", "DECLARED");
  EXPECT_THAT(replay(added), ElementsAre("7.service/Info.plist"));
  EXPECT_THAT(replay(added, {root + "7.service"}), ElementsAre("7.service/Info.plist"));
  EXPECT_THAT(replay(added, {root + "8.service", root + "nowhere"}), IsEmpty());
  const EventID written = position();
  fs::remove_all(root + "8.service");
  fs::rename(root + "9.service", root + "other.service");
  scratch.write("Services/10.service/Resources/German/ServicesMenu.strings", "decides nothing");
  scratch.write("Services/11.service/beside the dictionary", "nor this");
  EXPECT_THAT(replay(written), UnorderedElementsAre(".", "8.service/", "9.service/", "other.service/"));
  EXPECT_THAT(replay(written, {root + "8.service"}), ElementsAre("8.service/"));
  EXPECT_THAT(replay(start), testing::IsSupersetOf({"new.service/", "7.service/Info.plist", "9.service/"}));

  const EventID last = position();
  restart();
  EXPECT_GT(journal().currentEventID(), last);
  EXPECT_THAT(replay(last), IsEmpty());
  EXPECT_THAT(replay(written, {root + "8.service"}), ElementsAre("8.service/"));
}

TEST_P(EventJournalTest, WhatCannotBeToldIsFlagged) {
  bundle("a.service");
  const EventID first = journal().currentEventID();
  EXPECT_THAT(replay(first), ElementsAre(mustScan)) << "not seen when the position was given";
  const EventID start = position();
  EXPECT_THAT(replay(start, {scratch / "elsewhere/"}), ElementsAre(mustScan));
  EXPECT_THAT(replay(start + 1000), ElementsAre(wrapped)) << "not given out yet";
  EXPECT_THAT(replay(1), ElementsAre(wrapped));
  fs::rename(root, scratch / "moved");
  bundle("a.service");
  EXPECT_THAT(replay(start), ElementsAre(""));  // the root itself
  EXPECT_THAT(replay(start, {}, 0), ElementsAre(mustScan));

  const EventID before = position();
  fs::rename(root, scratch / "elsewhere");
  fs::create_directory_symlink(scratch / "elsewhere", scratch / "Services");
  EXPECT_THAT(replay(before), ElementsAre(mustScan)) << "what it was by another way";
  const EventID linked = position();
  scratch.write("elsewhere/a.service/Info.plist", "another");
  EXPECT_THAT(replay(linked), ElementsAre("a.service/Info.plist"));
  fs::remove(scratch / "Services");
  EXPECT_THAT(replay(linked), Contains(""));

  restart();
  std::string index = scratch.read("state/journal");
  index.back() ^= 1;
  scratch.write("state/journal", index);
  EXPECT_THAT(replay(linked), ElementsAre(wrapped));
  EXPECT_THAT(log.take(), Contains(testing::HasSubstr("damaged")));
}

TEST_P(EventJournalTest, ABundleCostsTwoRecordsAndTwoWatchesHoweverLargeItIs) {
  for (const int count : {2, 5000}) {
    bundle("a.service");
    for (int index = 0; index < count; ++index) {
      scratch.write("Services/a.service/" + std::to_string(index));
      scratch.write("Services/a.service/Resources/" + std::to_string(index) + "/file");
    }
    service().save();
    EXPECT_EQ(service().size().records, 3u) << "with the root";
    EXPECT_EQ(service().size().watches, GetParam() ? 3u : 0u);
    kill();
  }
}

TEST_P(EventJournalTest, HostileEntriesCostABoundedLook) {
  bundle("a.service");
  fs::create_directory_symlink("/", root + "everything.service");
  fs::create_directory_symlink("..", root + "loop.service");
  fs::create_symlink("self.service", root + "self.service");
  fs::create_directory(root + "fifo.service");
  ASSERT_EQ(mkfifo((root + "fifo.service/Info.plist").c_str(), 0600), 0);
  for (int index = 0; index < 100; ++index) {
    fs::create_directory_symlink("a.service", root + std::to_string(index) + ".service");
  }
  for (int index = 0; index < 10'000; ++index) scratch.write("Services/file" + std::to_string(index));
  scratch.write("Services/\xff\xfe/Info.plist", "no UTF-8");
  const EventID start = position();
  scratch.write("Services/\xff\xfe/Info.plist", "nor this");
  EXPECT_THAT(replay(start), IsEmpty());
  EXPECT_LT(service().size().records, 220u);
  scratch.write("Services/a.service/Info.plist", "DECLARED");
  EXPECT_EQ(replay(start).size(), 101u) << "once for each name of the bundle";
}

TEST_P(EventJournalTest, BeyondTheLimitsTheTruthIsFoundByLooking) {
  options.limits.mostWatches = 2;
  for (int index = 0; index < 1200; ++index) bundle(std::to_string(index) + ".service");
  const EventID start = position();
  scratch.write("Services/1100.service/Info.plist", "DECLARED");
  EXPECT_THAT(replay(start), ElementsAre("1100.service/Info.plist"));
  EXPECT_EQ(log.take().size(), 1u) << "once, whatever there is none of";

  restart();
  options.limits.mostRecords = 100;
  options.limits.mostGone = 10;
  for (int index = 100; index < 1200; ++index) {
    fs::rename(root + std::to_string(index) + ".service", root + "x" + std::to_string(index) + ".service");
  }
  EXPECT_THAT(replay(start), ElementsAre(mustScan));
  restart();
  options.limits.mostRecords = 100'000;
  options.longestLook = std::chrono::milliseconds(0);
  EXPECT_THAT(replay(start), ElementsAre(mustScan));
}

TEST_P(EventJournalTest, WhatWasToldIsNotTakenForUnknownWhenItIsAsBefore) {
  const Scratch other, state;
  const auto exchange = [&] {
    renameat2(AT_FDCWD, scratch.path().c_str(), AT_FDCWD, other.path().c_str(), RENAME_EXCHANGE);
  };
  bundle("a.service");
  other.write("Services/a.service/Info.plist", "another");
  options.directory = state.path();
  options.betweenSavings = std::chrono::hours(1);
  position();
  const EventID given = position();
  service().save();
  exchange();
  EXPECT_THAT(replay(given), ElementsAre(""));
  kill();
  exchange();
  EXPECT_THAT(replay(given), ElementsAre(wrapped));
}

TEST_P(EventJournalTest, AStateThatCannotBeWrittenGivesNoPositionAndIsTriedAgain) {
  bundle("a.service");
  const EventID before = position();
  restart();
  fs::permissions(scratch / "state", fs::perms::none);
  fs::rename(scratch / "state", scratch / "kept");
  scratch.write("state", "no directory");
  for (int start = 0; start < 3; ++start, kill()) EXPECT_EQ(journal().currentEventID(), 0u);
  EXPECT_EQ(journal().currentEventID(), 0u);
  EXPECT_FALSE(service().save());
  fs::remove(scratch / "state");
  fs::rename(scratch / "kept", scratch / "state");
  fs::permissions(scratch / "state", fs::perms::owner_all);
  const EventID after = journal().currentEventID();
  EXPECT_GT(after, 0u);
  EXPECT_TRUE(service().save()) << "what failed is tried again";
  EXPECT_FALSE(log.take().empty());
  kill();
  EXPECT_THAT(replay(before), ElementsAre(wrapped));
  EXPECT_THAT(replay(after), IsEmpty());
}

class LiveEventJournalTest : public EventJournalTest {
 protected:
  /// Waits for a hint after those that were given so far.
  bool isTold() { return news.wait(std::chrono::seconds(20)); }
  void forgetNews() {
    while (news.wait({})) {
    }
  }
  Semaphore news;
};
INSTANTIATE_TEST_SUITE_P(Live, LiveEventJournalTest, testing::Values(true));

TEST_P(LiveEventJournalTest, WhoOnlyWaitsIsToldOfWhatEventsDoNotTell) {
  changed = [this](JournalForest::Hints) { news.signal(); };
  fs::remove_all(root);
  hasInstance = false;
  options.limits.mostWatches = 1;
  options.limits.home = "/nowhere";
  options.betweenLooks = std::chrono::milliseconds(50);
  position();
  forgetNews();
  bundle("a.service");
  EXPECT_TRUE(isTold()) << "a root that comes late, without an instance";
  const EventID there = position();
  forgetNews();
  scratch.write("Services/a.service/Info.plist", "DECLARED");
  EXPECT_TRUE(isTold()) << "a dictionary, without an instance";
  hasInstance = true;
  while (service().size().watches == 0) std::this_thread::yield();
  const EventID watched = position();
  forgetNews();
  scratch.write("Services/a.service/Info.plist", "declared");
  EXPECT_TRUE(isTold()) << "a dictionary, without a watch of its own";
  EXPECT_THAT(replay(watched), ElementsAre("a.service/Info.plist"));
  EXPECT_THAT(replay(there), ElementsAre("a.service/Info.plist"));
}

TEST_P(LiveEventJournalTest, ADictionaryBehindALinkToALargeDirectoryIsToldAtOnce) {
  changed = [this](JournalForest::Hints) { news.signal(); };
  options.betweenLooks = std::chrono::hours(1);
  for (int index = 0; index < 2000; ++index) scratch.write("elsewhere/" + std::to_string(index));
  scratch.write("elsewhere/Info.plist", "declared");
  fs::create_directory_symlink(scratch / "elsewhere", root + "linked.service");
  position();
  forgetNews();
  scratch.write("elsewhere/Info.plist", "DECLARED");
  EXPECT_TRUE(isTold());
}

TEST_P(LiveEventJournalTest, WhatDecidesNothingWakesNobody) {
  changed = [this](JournalForest::Hints) { news.signal(); };
  options.limits.home = scratch / "home";
  options.betweenLooks = std::chrono::hours(1);
  bundle("a.service");
  position();
  forgetNews();
  scratch.write("beside");
  fs::remove(scratch / "beside");
  scratch.write("Services/a.service/Resources/German/ServicesMenu.strings");
  replay(position());
  EXPECT_FALSE(news.wait({}));
}

TEST_P(LiveEventJournalTest, AnOverflowOfTheEventQueueIsMadeUpFor) {
  std::promise<void> entered, released;
  std::atomic<bool> isHeld = false;
  changed = [&](JournalForest::Hints) {
    if (isHeld.exchange(false)) entered.set_value(), released.get_future().wait();
  };
  bundle("a.service");
  const EventID start = position();
  isHeld = true;
  bundle("b.service");
  entered.get_future().wait();  // the journal's thread is held here
  for (int index = 0; index < 20'000; ++index)
    fs::rename(root + "a.service", root + "c.service"), fs::rename(root + "c.service", root + "a.service");
  scratch.write("Services/a.service/Info.plist", "DECLARED");
  bundle("d.service");
  released.set_value();
  EXPECT_THAT(replay(start), ElementsAre(mustScan));
  EXPECT_THAT(log.take(), ElementsAre(testing::HasSubstr("faster than they could be told")));
  const EventID later = position();
  scratch.write("Services/d.service/Info.plist", "DECLARED");
  EXPECT_THAT(replay(later), ElementsAre("d.service/Info.plist"));
}

}  // namespace
}  // namespace kel::platform
