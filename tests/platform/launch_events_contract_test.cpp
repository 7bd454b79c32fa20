#include "platform/linux/notifications/linux_notification_seeds.h"
#include "platform/linux/registry/linux_launch_events.h"
#include "platform/linux/scratch.h"
#include "support/in_memory_services.h"

namespace kel::platform {
namespace {

constexpr const char* applicationChanges = "com.orvex.beacond.matching";
constexpr const char* seeding = "com.orvex.broadcastd.matching";
constexpr const char* serviceChanges = "com.orvex.vigil.matching";
constexpr const char* unknown = "com.orvex.other.matching";

struct InMemoryStreams {
  void cause(const std::string& stream) { launchEvents.fire.at(stream)(); }

  test::InMemoryLaunchEvents launchEvents;
};

struct LinuxStreams {
  LinuxStreams() {
    journal.watch({services});
    journal.changedSince({services, applications},
                         journal.currentEventID());  // what a first look finds is news
  }
  ~LinuxStreams() {
    EXPECT_THAT(log.take(), testing::ElementsAre(std::string("There is no launch-event stream ") + unknown));
  }

  /// The application registry is seeded of itself.
  void cause(const std::string& stream) {
    journal.currentEventID();  // everything is watched by now
    if (stream == applicationChanges) scratch.write("Applications/Tools/a.app/Info.plist");
    if (stream == serviceChanges) scratch.write("Services/a.service/Info.plist");
  }

  const Scratch scratch;
  const std::string services = scratch.makeDirectory("Services") + "/";
  const std::string applications = scratch.makeDirectory("Applications") + "/";
  test::RecordingLog log;
  LinuxFileSystem files{log};
  ConcurrentQueue pool;
  LinuxNotificationSeeds seeds{scratch / "run", log};
  LinuxEventJournal journal{{{applications}, scratch / "state", {}}, files, log, pool};
  LinuxApplicationRegistry registry{files, log, pool, {applications}, scratch / "state", &journal};
  LinuxLaunchEvents launchEvents{seeds, log, journal, registry};
};

template <typename Streams>
class LaunchEventsContractTest : public testing::Test {};
using AllStreams = testing::Types<InMemoryStreams, LinuxStreams>;
TYPED_TEST_SUITE(LaunchEventsContractTest, AllStreams);

TYPED_TEST(LaunchEventsContractTest, EveryStreamFiresAtTheStartAndForItsOwnChangesAndAnUnknownOneNever) {
  std::map<std::string, Semaphore> fired;
  const auto hasFired = [&](const char* name) { return fired[name].wait(std::chrono::seconds(0)); };
  SerialQueue queue("handlers");
  TypeParam streams;
  queue.sync([&] {
    for (const char* name : {applicationChanges, seeding, serviceChanges, unknown}) {
      streams.launchEvents.setHandler(name, queue, [&stream = fired[name]] { stream.signal(); });
    }
    EXPECT_FALSE(hasFired(applicationChanges) || hasFired(seeding) || hasFired(serviceChanges));
    queue.async(
        [&] { EXPECT_TRUE(hasFired(applicationChanges) && hasFired(seeding) && hasFired(serviceChanges)); });
  });
  queue.sync([] {});
  for (const char* name : {seeding, serviceChanges, applicationChanges}) {
    EXPECT_FALSE(hasFired(applicationChanges) || hasFired(unknown)) << "before " << name;
    streams.cause(name);
    EXPECT_TRUE(fired[name].wait(std::chrono::seconds(30))) << name;
  }
}

}  // namespace
}  // namespace kel::platform
