#include "platform/linux/notifications/linux_notification_seeds.h"
#include "platform/linux/scratch.h"

namespace kel::platform {
namespace {

using namespace std::chrono_literals;

struct InMemoryWorld {
  test::InMemorySeeds seeds;
  test::InMemorySeeds& other = seeds;
};

struct LinuxWorld {
  Scratch scratch;
  test::RecordingLog log;
  LinuxNotificationSeeds seeds{scratch / "beacond", log}, other{scratch / "beacond", log};
};

template <class World>
struct NotificationSeedsContract : testing::Test {
  auto observe(const std::string& name, Semaphore& posted) {
    return seeds.observe(name, queue, [&] { queue.assertCurrent(), posted.signal(); });
  }
  /// True when a call came of what has happened.
  bool wasCalled() {
    for (int round = 0; round < 3; ++round) queue.sync([] {});
    return called.wait(0s);
  }

  World world;
  NotificationSeeds& seeds = world.seeds;
  NotificationSeeds& other = world.other;  // the service as another process has it
  Semaphore called, calledForSecond;
  SerialQueue queue{"observer"};
};
using Worlds = testing::Types<InMemoryWorld, LinuxWorld>;
TYPED_TEST_SUITE(NotificationSeedsContract, Worlds);

TYPED_TEST(NotificationSeedsContract, EveryNameHasOneTokenAndAStateThatAllProcessesShare) {
  const auto name = this->seeds.registerName("name"), second = this->seeds.registerName("second");
  EXPECT_EQ(this->seeds.registerName("name"), name);
  EXPECT_EQ(this->seeds.state(name), 0U);
  this->seeds.setState(name, ~std::uint64_t{0});
  this->other.setState(this->other.registerName("second"), 2);
  EXPECT_EQ(this->other.state(this->other.registerName("name")), ~std::uint64_t{0});
  EXPECT_EQ(this->seeds.state(second), 2U);
}

TYPED_TEST(NotificationSeedsContract, ObserverHearsOfEveryProcessesPostsOfItsNameAndOfNothingElse) {
  auto observation = this->observe("name", this->called);
  auto second = this->observe("second", this->calledForSecond);
  this->seeds.setState(this->seeds.registerName("name"), 1);
  this->other.post("second");
  EXPECT_TRUE(this->calledForSecond.wait(20s));
  EXPECT_FALSE(this->wasCalled()) << "for a new state, or for a post of another name";
  for (int post = 1; post <= 20; ++post) {
    (post % 2 ? this->seeds : this->other).post("name");
    EXPECT_TRUE(this->called.wait(20s)) << post;
  }
  this->queue.sync([&] { observation.reset(), second.reset(); });
}

TYPED_TEST(NotificationSeedsContract, ObservationMayEndItselfAndNoCallStartsAfterItsEnd) {
  auto ended = this->observe("name", this->called);
  std::unique_ptr<NotificationSeeds::Observation> observation;
  this->queue.sync([&] {
    this->seeds.post("name");  // its call waits behind this task
    ended.reset();
    observation =
        this->other.observe("name", this->queue, [&] { observation.reset(), this->called.signal(); });
  });
  EXPECT_FALSE(this->wasCalled());
  this->seeds.post("name");
  EXPECT_TRUE(this->called.wait(20s));
  this->seeds.post("name");
  EXPECT_FALSE(this->wasCalled());
}

}  // namespace
}  // namespace kel::platform
