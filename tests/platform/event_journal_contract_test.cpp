#include "platform/linux/journal/linux_event_journal.h"
#include "platform/linux/scratch.h"
#include "support/in_memory_services.h"

namespace kel::platform {
namespace {

using testing::ElementsAre;

struct InMemoryDisk {
  void change(const std::string& bundle) { journal.record(root + bundle + "/"); }
  /// A position since which not everything can be told.
  EventID lostPosition() {
    journal.record(root, event_flags::mustScanSubDirectories);
    return journal.currentEventID() - 1;
  }

  const std::string root = "/A/Services/";
  test::InMemoryJournal journal;
};

struct LinuxDisk {
  void change(const std::string& bundle) { scratch.write("Services/" + bundle + "/Info.plist"); }
  EventID lostPosition() { return beforeTheFirstLook; }

  JournalOptions options() {
    JournalOptions options;
    options.directory = scratch / "state";
    return options;
  }

  const Scratch scratch;
  const std::string root = scratch.makeDirectory("Services") + "/";
  test::RecordingLog log;
  LinuxFileSystem files{log};
  ConcurrentQueue pool;
  LinuxEventJournal journal{options(), files, log, pool};
  EventID beforeTheFirstLook = 0;
};

/// Reads one stream after the other.
template <typename Disk>
class EventJournalContractTest : public testing::Test {
 protected:
  using Told = std::set<std::string>;

  EventJournalContractTest() {
    disk.journal.watch({disk.root});
    const EventID start = disk.journal.currentEventID();
    if constexpr (std::is_same_v<Disk, LinuxDisk>) disk.beforeTheFirstLook = start;
    past(start);  // a journal may have to look before it can tell
  }
  ~EventJournalContractTest() override { close(); }

  void open(EventID since, const std::string& path = {}) {
    close();
    told.set({});
    const auto callback = [this](const auto& events) { take(events); };
    stream = disk.journal.createStream(callback, {disk.root + path}, since, {}, 0);
  }
  void close() {
    if (stream) queue.sync([this] { stream->invalidate(); });
    stream.reset();
  }
  Told past(EventID since, const std::string& path = {}) {
    open(since, path);
    stream->setQueue(queue);
    EXPECT_TRUE(stream->start() && isTold("done"));
    return told.copy();
  }
  bool isTold(const std::string& name) {
    while (!told.copy().contains(name)) {
      if (!news.wait(std::chrono::seconds(30))) return false;
    }
    return true;
  }

  Disk disk;
  Guarded<Told> told;  ///< names of bundles, "done" for the end of the past, "scan" for what cannot be told
  Semaphore news;
  SerialQueue queue{"stream", 0};
  std::unique_ptr<JournalStream> stream;

 private:
  void take(const std::vector<JournalEvent>& events) {
    EXPECT_TRUE(queue.isCurrent());
    for (const JournalEvent& event : events) {
      std::string name = event.path.substr(std::min(event.path.size(), disk.root.size()));
      name = name.substr(0, name.find('/'));
      if (event.flags & event_flags::mustScanSubDirectories) name = "scan";
      if (event.flags & event_flags::historyDone) name = "done";
      EXPECT_TRUE(name != "done" || &event == &events.back());
      if (name != ".") told.with([&](Told& names) { names.insert(name); });
    }
    news.signal();
  }
};
using Disks = testing::Types<InMemoryDisk, LinuxDisk>;
TYPED_TEST_SUITE(EventJournalContractTest, Disks);

TYPED_TEST(EventJournalContractTest, WhatHappenedSinceAPositionBelowAPathIsToldAndThenTheEnd) {
  const EventID start = this->disk.journal.currentEventID();
  this->disk.change("a.service");
  const EventID between = this->disk.journal.currentEventID();
  EXPECT_GT(between, start);
  this->disk.change("a.service2");
  EXPECT_THAT(this->past(start), ElementsAre("a.service", "a.service2", "done"));
  EXPECT_THAT(this->past(start, "a.service"), ElementsAre("a.service", "done"));
  EXPECT_THAT(this->past(start, "nowhere"), ElementsAre("done"));
  EXPECT_THAT(this->past(between), ElementsAre("a.service2", "done"));
  EXPECT_THAT(this->past(this->disk.lostPosition()), ElementsAre("done", "scan"));
}

TYPED_TEST(EventJournalContractTest, NothingIsToldWithoutAQueueOrOnceTheStreamIsStoppedAndInvalid) {
  this->open(this->disk.journal.currentEventID());
  EXPECT_FALSE(this->stream->start());
  this->stream->setQueue(this->queue);
  this->disk.change("a.service");
  this->queue.sync([&] {
    EXPECT_TRUE(this->stream->start());
    this->disk.journal.currentEventID();  // the past is on its way by now
    this->stream->stop();
    this->stream->invalidate();
  });
  this->disk.change("b.service");
  this->disk.journal.currentEventID();
  this->queue.sync([] {});
  EXPECT_THAT(this->told.copy(), testing::IsEmpty());
}

}  // namespace
}  // namespace kel::platform
