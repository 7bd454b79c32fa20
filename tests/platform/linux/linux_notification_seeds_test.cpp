#include "platform/linux/linux_notification_seeds.h"

#include <condition_variable>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>

#include "platform/linux/linux_launch_events.h"
#include "platform/linux/scratch.h"

namespace kel::platform {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;
using testing::SizeIs;
using namespace std::chrono_literals;

constexpr auto generously = 20s;

/// Counts calls; waiting for one has a limit.
class Calls {
 public:
  std::function<void()> handler() {
    return [this] {
      const std::lock_guard lock(mutex_);
      ++count_;
      changed_.notify_all();
    };
  }
  bool reach(int count) {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, generously, [&] { return count_ >= count; });
  }
  int count() {
    const std::lock_guard lock(mutex_);
    return count_;
  }

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  int count_ = 0;
};

class LinuxNotificationSeedsTest : public testing::Test {
 protected:
  Scratch scratch;
  CollectedLog log;
  SerialQueue queue{"observer"};
  LinuxNotificationSeeds seeds{scratch / "beacond", log};
  LinuxNotificationSeeds other{scratch / "beacond", log};  // stands for another process
  NotificationStore store{scratch / "beacond"};
  Calls calls;
};

TEST_F(LinuxNotificationSeedsTest, StateIsSharedByInstancesAndKeptPerName) {
  const auto token = seeds.registerName("a name");
  EXPECT_EQ(seeds.registerName("a name"), token);
  EXPECT_NE(seeds.registerName("another"), token);
  EXPECT_EQ(seeds.state(token), 0u);
  seeds.setState(token, 0xfedcba9876543210);
  seeds.post("a name");
  EXPECT_EQ(other.state(other.registerName("a name")), 0xfedcba9876543210);
  EXPECT_EQ(other.state(other.registerName("another")), 0u);
  EXPECT_EQ(seeds.state(99), 0u);
  EXPECT_EQ(seeds.state(-1), 0u);
  EXPECT_EQ(scratch.mode("beacond"), 0700u);
  EXPECT_EQ(scratch.mode("beacond/a%20name"), 0600u);
  EXPECT_THAT(log.lines(), IsEmpty()) << "a name that was never set is no failure";
}

TEST_F(LinuxNotificationSeedsTest, PostsOfManyThreadsAndInstancesAreAllCounted) {
  seeds.post("name");
  const auto start = store.read("name")->posts;
  constexpr int posts = 250;
  std::vector<std::thread> threads;
  for (LinuxNotificationSeeds* instance : {&seeds, &other, &seeds, &other}) {
    threads.emplace_back([instance] {
      for (int i = 0; i < posts; ++i) instance->post("name");
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(store.read("name")->posts, start + 4 * posts);
  EXPECT_THAT(scratch.names("beacond"), ElementsAre(".lock", "name"));
}

TEST_F(LinuxNotificationSeedsTest, RecordThatIsCutOrChangedAnywhereCountsAsNeverSet) {
  const auto token = seeds.registerName("name");
  seeds.setState(token, 7);
  const std::string whole = scratch.read("beacond/name");
  const auto stateOf = [&](const std::string& contents) {
    scratch.write("beacond/name", contents);
    return seeds.state(token);
  };
  for (std::size_t length = 0; length < whole.size(); ++length) {
    EXPECT_EQ(stateOf(whole.substr(0, length)), 0u) << length;
    std::string changed = whole;
    changed[length] = static_cast<char>(changed[length] ^ 1);
    EXPECT_EQ(stateOf(changed), 0u) << length;
  }
  EXPECT_EQ(stateOf(whole + "x"), 0u);
  EXPECT_EQ(stateOf(whole), 7u);
  EXPECT_THAT(log.lines(), SizeIs(1)) << "reported once";
  stateOf("damaged");
  seeds.setState(token, 8);
  EXPECT_EQ(seeds.state(token), 8u);
}

TEST_F(LinuxNotificationSeedsTest, EveryPostIsSeenAndANewStateAloneIsNone) {
  const auto token = seeds.registerName("name");
  auto observation = seeds.observe("name", queue, calls.handler());
  for (int post = 1; post <= 20; ++post) {
    (post % 2 ? seeds : other).post("name");
    ASSERT_TRUE(calls.reach(post)) << post;
    seeds.setState(token, static_cast<std::uint64_t>(post));
    seeds.post("another");
  }
  EXPECT_EQ(calls.count(), 20);
  queue.sync([&] { observation.reset(); });
}

TEST_F(LinuxNotificationSeedsTest, PostIsSeenAfterDamageAndAfterTheDirectoryWasLost) {
  seeds.post("name");
  auto observation = seeds.observe("name", queue, calls.handler());
  scratch.write("beacond/name", "damaged");
  other.post("name");
  EXPECT_TRUE(calls.reach(1));
  std::filesystem::remove_all(scratch / "beacond");
  // The directory is watched again once the loss was seen.
  const auto deadline = std::chrono::steady_clock::now() + generously;
  while (!std::filesystem::exists(scratch / "beacond") && std::chrono::steady_clock::now() < deadline) {
    queue.sync([] {});
  }
  other.post("name");
  EXPECT_TRUE(calls.reach(2));
  queue.sync([&] { observation.reset(); });
}

TEST_F(LinuxNotificationSeedsTest, NothingRunsAfterTheObservationIsGone) {
  auto observation = seeds.observe("name", queue, calls.handler());
  queue.sync([&] {
    seeds.post("name");  // its event waits behind this task
    observation.reset();
  });
  Calls marker;
  auto second = seeds.observe("name", queue, marker.handler());
  seeds.post("name");
  EXPECT_TRUE(marker.reach(1));
  queue.sync([&] { second.reset(); });
  EXPECT_EQ(calls.count(), 0);
}

TEST_F(LinuxNotificationSeedsTest, ObservationMayEndItself) {
  std::unique_ptr<NotificationSeeds::Observation> observation;
  const auto handler = calls.handler();
  queue.sync([&] {
    observation = seeds.observe("name", queue, [&observation, handler] {
      observation.reset();
      handler();
    });
  });
  seeds.post("name");
  EXPECT_TRUE(calls.reach(1));
}

TEST_F(LinuxNotificationSeedsTest, UnusableDirectoryIsReportedOnceAndAbsorbed) {
  LinuxNotificationSeeds broken(scratch.write("file", "") + "/beacond", log);
  const auto token = broken.registerName("name");
  for (int i = 0; i < 3; ++i) {
    broken.setState(token, 1);
    broken.post("name");
    EXPECT_EQ(broken.state(token), 0u);
  }
  auto observation = broken.observe("name", queue, calls.handler());
  EXPECT_THAT(log.lines(), SizeIs(3)) << "one for writing, one for reading, one for watching";
  queue.sync([&] { observation.reset(); });
}

TEST(NotificationFileName, NamesNeverLeaveTheDirectoryOrMeetEachOther) {
  const std::pair<std::string, std::optional<std::string>> rows[] = {
      {"user.uid.0.com.orvex.qvservices.seed", "user.uid.0.com.orvex.qvservices.seed"},
      {"../x", "%2E.%2Fx"},
      {".lock", "%2Elock"},
      {"%2Elock", "%252Elock"},
      {std::string("a\0\xff", 3), "a%00%FF"},
      {"", std::nullopt},
      {std::string(200, 'a'), std::string(200, 'a')},
      {std::string(201, 'a'), std::nullopt},
      {std::string(67, '/'), std::nullopt},
  };
  for (const auto& [name, file] : rows) EXPECT_EQ(notificationFileName(name), file);
}

TEST_F(LinuxNotificationSeedsTest, EachLaunchEventStreamFiresAtTheStartAndRegistryChangesLater) {
  LinuxLaunchEvents events(seeds, log);
  std::vector<std::string> order;
  for (const char* stream : {"com.orvex.beacond.matching", "com.orvex.broadcastd.matching",
                             "com.orvex.vigil.matching", "com.orvex.unknown"}) {
    events.setHandler(stream, queue, [&, stream, called = calls.handler()] {
      order.emplace_back(stream);
      called();
    });
  }
  queue.sync([&order] { order.emplace_back("a request"); });
  EXPECT_TRUE(calls.reach(3));
  other.post("com.orvex.AppRegistry.DatabaseChange");
  EXPECT_TRUE(calls.reach(4));
  queue.sync([&order] {
    EXPECT_THAT(order, ElementsAre("com.orvex.beacond.matching", "com.orvex.broadcastd.matching",
                                   "com.orvex.vigil.matching", "a request", "com.orvex.beacond.matching"));
  });
  EXPECT_THAT(log.lines(), ElementsAre("There is no launch-event stream com.orvex.unknown"));
}

}  // namespace
}  // namespace kel::platform
