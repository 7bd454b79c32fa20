#include "platform/linux/registry/linux_launch_events.h"

#include "platform/linux/notifications/linux_notification_seeds.h"
#include "platform/linux/scratch.h"

namespace kel::platform {
namespace {

/// A stream's handler that can be waited for.
struct Stream {
  explicit Stream(const std::string& kind) : name("com.orvex." + kind + ".matching") {}
  bool fires() { return fired.wait(std::chrono::seconds(30)); }
  bool hasFired() { return fired.wait(std::chrono::nanoseconds::zero()); }

  const std::string name;
  Semaphore fired;
};

TEST_F(ScratchTest, EveryLaunchEventStreamFiresAtTheStartAndForItsOwnChanges) {
  const std::string services = scratch.makeDirectory("Services") + "/";
  const std::string applications = scratch.makeDirectory("Applications") + "/";
  ConcurrentQueue pool;
  LinuxNotificationSeeds seeds(scratch / "run", log);
  LinuxEventJournal journal({}, files, log, pool);
  journal.setRoots({{services, false}, {applications, true}});
  LinuxApplicationRegistry registry(files, log, pool, {applications}, scratch / "state", &journal);
  SerialQueue queue("handlers");
  Stream beacond("beacond"), broadcastd("broadcastd"), vigil("vigil");
  LinuxLaunchEvents launchEvents(seeds, log, journal, registry);
  queue.sync([&] {
    for (Stream* stream : {&beacond, &broadcastd, &vigil}) {
      launchEvents.setHandler(stream->name, queue, [stream] { stream->fired.signal(); });
    }
  });
  queue.sync([] {});
  EXPECT_TRUE(beacond.hasFired() && broadcastd.hasFired() && vigil.hasFired()) << "at the start";
  EXPECT_TRUE(broadcastd.fires()) << "at the end of the first scan";

  journal.service()->save();  // everything is watched by now
  EXPECT_TRUE(vigil.fires() && beacond.fires()) << "for what was never looked at before";
  while (vigil.hasFired()) {
  }
  scratch.write("Services/a.service/Info.plist");
  EXPECT_TRUE(vigil.fires());
  EXPECT_FALSE(beacond.hasFired());
  scratch.write("Applications/Tools/a.app/Info.plist");
  EXPECT_TRUE(vigil.fires() && beacond.fires());
  launchEvents.setHandler("com.orvex.other.matching", queue, [] {});
  EXPECT_THAT(log.take(), testing::ElementsAre("There is no launch-event stream com.orvex.other.matching"));
}

}  // namespace
}  // namespace kel::platform
