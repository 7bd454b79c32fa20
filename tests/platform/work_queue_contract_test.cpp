#include <algorithm>
#include <atomic>
#include <gmock/gmock.h>
#include <latch>
#include <memory>
#include <thread>
#include <vector>

#include "platform/work_queue.h"

// What the classes promise whichever platform's bodies are linked in: nothing else is included.
namespace kel::platform {
namespace {

using namespace std::chrono_literals;
using testing::ElementsAre;

TEST(SerialQueueTest, TasksOfSeveralThreadsRunOneAtATimeInTheOrderEachHandedThemOver) {
  std::vector<std::vector<int>> seen(4);
  {
    SerialQueue queue("order");
    std::vector<std::thread> threads;
    for (auto& own : seen) {
      threads.emplace_back([&queue, &own] {
        for (int i = 0; i < 1000; ++i) queue.async([&own, i] { own.push_back(i); });
      });
    }
    for (auto& thread : threads) thread.join();
  }
  for (const auto& own : seen) {
    EXPECT_TRUE(own.size() == 1000 && std::is_sorted(own.begin(), own.end()));
  }
}

TEST(SerialQueueTest, TimersRunInTheOrderOfTheirDeadlinesNotBeforeThemAndAreDroppedWithTheQueue) {
  auto queue = std::make_unique<SerialQueue>("timers");
  std::vector<int> seen;
  Semaphore done;
  const auto held = std::make_shared<int>();
  const auto start = std::chrono::steady_clock::now();
  queue->sync([&] {
    queue->after(100ms, [&] { done.signal(); });
    queue->after(1ms, [&] { seen.push_back(1); });
    queue->after(1ms, [&] { seen.push_back(2); });
    queue->after(std::chrono::nanoseconds::max(), [&, held] { seen.push_back(3); });
    queue->after(-1s, [&] { seen.push_back(0); });
  });
  ASSERT_TRUE(done.wait(30s));
  EXPECT_GE(std::chrono::steady_clock::now() - start, 100ms);
  queue.reset();
  EXPECT_THAT(seen, ElementsAre(0, 1, 2));
  EXPECT_EQ(held.use_count(), 1) << "the timer's task outlived the queue";
}

TEST(SerialQueueTest, ATaskMayDestroyItsQueueAndTheThreadGoesOnToRunTheRest) {
  auto queue = std::make_unique<SerialQueue>("own end");
  std::latch ran(1);
  queue->sync([&] {
    queue->async([&] { queue.reset(); });
    queue->async([&] { ran.count_down(); });
  });
  ran.wait();
  EXPECT_EQ(queue, nullptr);
}

TEST(SerialQueueTest, AQueueWaitsForDeeperOnesOnly) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  const auto nested = [](int outer, int inner) {
    SerialQueue waiting("waiting", outer), waitedFor("waited for", inner);
    bool ran = false;
    waiting.sync([&] { waitedFor.sync([&] { ran = waitedFor.isCurrent() && !waiting.isCurrent(); }); });
    return ran;
  };
  EXPECT_TRUE(nested(1, 2) && nested(0, SerialQueue::deepest));
  EXPECT_DEBUG_DEATH(nested(2, 1), "");
  EXPECT_DEBUG_DEATH(nested(SerialQueue::deepest, SerialQueue::deepest), "");
}

TEST(ConcurrentQueueTest, ApplyNestedDeeperThanThePoolHasThreadsCallsEveryIndexOnceOnSeveralThreads) {
  ConcurrentQueue queue;
  std::latch both(2);
  queue.apply(2, [&](std::size_t) { both.arrive_and_wait(); });
  constexpr std::size_t width = 3, depth = 6, leaves = 729;
  std::vector<std::atomic<int>> calls(leaves);
  std::function<void(std::size_t, std::size_t)> descend = [&](std::size_t level, std::size_t prefix) {
    if (level == depth) {
      ++calls[prefix];
      return;
    }
    queue.apply(width, [&, level, prefix](std::size_t i) { descend(level + 1, prefix * width + i); });
  };
  descend(0, 0);
  EXPECT_THAT(std::vector<int>(calls.begin(), calls.end()), testing::Each(1));
}

TEST(GroupTest, AGroupIsWaitedForWithTheTasksThatItsTasksAdd) {
  ConcurrentQueue queue;
  Group group;
  std::atomic<int> ran = 0;
  for (int i = 0; i < 100; ++i) {
    group.async(queue, [&] { group.async(queue, [&] { ++ran; }); });
  }
  group.wait();
  EXPECT_EQ(ran, 100);
}

TEST(SemaphoreTest, AWaitTakesWhatIsThereAndGivesUpWhenItsTimeIsOver) {
  Semaphore semaphore(1);
  EXPECT_TRUE(semaphore.wait(0s));
  EXPECT_FALSE(semaphore.wait(1ms));
  semaphore.signal();
  EXPECT_TRUE(semaphore.wait(std::chrono::nanoseconds::max()));
}

}  // namespace
}  // namespace kel::platform
