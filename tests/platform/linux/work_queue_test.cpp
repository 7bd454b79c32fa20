#include "platform/work_queue.h"

#include <array>
#include <atomic>
#include <gmock/gmock.h>
#include <latch>
#include <memory>
#include <optional>
#include <pthread.h>
#include <signal.h>
#include <string>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <thread>
#include <vector>

#include "platform/linux/event_loop.h"
#include "platform/linux/linux_clock.h"

namespace kel::platform {
namespace {

using namespace std::chrono_literals;
using testing::Each;
using testing::ElementsAre;

std::string threadName() {
  std::array<char, 16> name{};
  pthread_getname_np(pthread_self(), name.data(), name.size());
  return name.data();
}

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
    EXPECT_TRUE(std::is_sorted(own.begin(), own.end()));
    EXPECT_EQ(own.size(), 1000U) << "destroying the queue dropped tasks";
  }
}

TEST(SerialQueueTest, SyncReturnsAfterTheTaskAndWhatWasQueuedBeforeIt) {
  SerialQueue queue("KEL Conduit Server");
  std::vector<std::string> seen;
  queue.async([&] { seen.push_back("before"); });
  queue.sync([&] { seen.push_back(threadName() + (queue.isCurrent() ? ", current" : "")); });
  EXPECT_THAT(seen, ElementsAre("before", "KEL Conduit Ser, current"));
  EXPECT_FALSE(queue.isCurrent());
}

TEST(SerialQueueTest, TimersRunInTheOrderOfTheirDeadlinesNotBeforeThem) {
  SerialQueue queue("timers");
  LinuxClock clock;
  std::vector<int> seen;
  Semaphore done;
  const auto start = std::chrono::steady_clock::now();
  queue.sync([&] {
    clock.after(queue, 100ms, [&] {
      seen.push_back(3);
      done.signal();
    });
    clock.after(queue, 1ms, [&] { seen.push_back(1); });
    clock.after(queue, 1ms, [&] { seen.push_back(2); });
    clock.after(queue, std::chrono::nanoseconds::max(), [&] { seen.push_back(4); });
    clock.after(queue, -1s, [&] { seen.push_back(0); });
  });
  ASSERT_TRUE(clock.wait(done, 30s));
  EXPECT_GE(std::chrono::steady_clock::now() - start, 100ms);
  queue.sync([&] { EXPECT_THAT(seen, ElementsAre(0, 1, 2, 3)); });
}

TEST(SerialQueueTest, DestructionRunsWhatQueuedTasksQueueAndDropsTimersThatAreNotDue) {
  std::vector<int> seen;
  const auto held = std::make_shared<int>();
  {
    SerialQueue queue("drain");
    queue.after(1h, [&seen, held] { seen.push_back(3); });
    queue.async([&] {
      seen.push_back(1);
      queue.async([&] { seen.push_back(2); });
    });
  }
  EXPECT_THAT(seen, ElementsAre(1, 2));
  EXPECT_EQ(held.use_count(), 1) << "the timer's task outlived the queue";
}

TEST(SerialQueueTest, ATaskMayDestroyItsQueueAndTheThreadGoesOnToRunTheRest) {
  std::latch ran(1);
  auto queue = std::make_unique<SerialQueue>("own end");
  SerialQueue& handle = *queue;
  std::latch destroyed(1);
  handle.sync([&] {
    handle.async([&] {
      queue.reset();
      destroyed.count_down();
    });
    handle.async([&] {
      destroyed.wait();
      ran.count_down();
    });
  });
  ran.wait();
  EXPECT_EQ(queue, nullptr);
}

TEST(SerialQueueTest, ItsThreadLeavesSignalsToOthers) {
  SerialQueue queue("signals");
  sigset_t mask;
  queue.sync([&] { pthread_sigmask(SIG_SETMASK, nullptr, &mask); });
  EXPECT_TRUE(sigismember(&mask, SIGTERM));
  EXPECT_FALSE(sigismember(&mask, SIGSEGV));
}

TEST(EventLoopTest, ADescriptorRemovedByAnotherOnesCallbackIsNotServedEvenWhenItsEventWasFetched) {
  SerialQueue queue("watch");
  const OwnedDescriptor first(eventfd(1, EFD_CLOEXEC)), second(eventfd(1, EFD_CLOEXEC));
  std::array<std::unique_ptr<EventLoop::Watch>, 2> watches;
  std::vector<std::string> served;
  const auto serve = [&](const char* name) {
    served.push_back(name);
    watches = {};
  };
  queue.sync([&] {
    watches[0] = queue.loop().watch(first.get(), EPOLLIN, [&](std::uint32_t) { serve("first"); });
    watches[1] = queue.loop().watch(second.get(), EPOLLIN, [&](std::uint32_t) { serve("second"); });
  });
  for (int i = 0; i < 3; ++i) queue.sync([] {});
  queue.sync([&] { EXPECT_THAT(served, testing::SizeIs(1)); });
}

TEST(EventLoopTest, AReadyDescriptorIsServedThoughTasksKeepComing) {
  SerialQueue queue("fair");
  const OwnedDescriptor descriptor(eventfd(1, EFD_CLOEXEC));
  std::unique_ptr<EventLoop::Watch> watch;
  bool served = false;
  Semaphore done;
  Task again = [&] { served ? done.signal() : queue.async(again); };
  queue.sync([&] {
    watch = queue.loop().watch(descriptor.get(), EPOLLIN, [&](std::uint32_t) {
      served = true;
      watch.reset();
    });
  });
  queue.async(again);
  EXPECT_TRUE(done.wait(30s));
  queue.sync([] {});
}

TEST(ConcurrentQueueTest, ApplyNestedDeeperThanThePoolHasThreadsCallsEveryIndexOnce) {
  ConcurrentQueue queue;
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
  EXPECT_THAT(calls, Each(testing::ResultOf([](const std::atomic<int>& n) { return n.load(); }, 1)));
}

TEST(ConcurrentQueueTest, ApplyRunsItsCallsOnSeveralThreadsAtOnce) {
  ConcurrentQueue queue;
  std::latch both(2);
  queue.apply(2, [&](std::size_t) { both.arrive_and_wait(); });
}

TEST(GroupTest, WaitReturnsWhenTasksQueuedByTasksHaveRunTooAndLetGo) {
  ConcurrentQueue queue;
  Group group;
  std::atomic<int> ran = 0;
  const auto held = std::make_shared<int>();
  for (int i = 0; i < 100; ++i) {
    group.async(queue, [&, held] {
      group.async(queue, [&, held] { ++ran; });
      ++ran;
    });
  }
  group.wait();
  EXPECT_EQ(ran, 200);
  EXPECT_EQ(held.use_count(), 1);
}

TEST(SemaphoreTest, AWaitTakesWhatIsThereAndGivesUpWhenItsTimeIsOver) {
  Semaphore semaphore(1);
  EXPECT_TRUE(semaphore.wait(0s));
  EXPECT_FALSE(semaphore.wait(-1s));
  EXPECT_FALSE(semaphore.wait(1ms));
  std::thread other([&] { semaphore.signal(); });
  EXPECT_TRUE(semaphore.wait(std::chrono::nanoseconds::max()));
  other.join();
}

TEST(SemaphoreTest, APokeMakesAWaiterAskAgainAndNeverCostsASignal) {
  Semaphore semaphore;
  std::atomic<int> asked = 0;
  std::latch askedOnce(1);
  std::thread waiter([&] {
    EXPECT_FALSE(semaphore.waitUnless([&] {
      if (++asked == 1) askedOnce.count_down();
      return asked == 3;
    }));
  });
  askedOnce.wait();
  while (asked < 3) semaphore.poke();
  waiter.join();
  EXPECT_TRUE(semaphore.waitUnless([&] {
    semaphore.signal();
    return true;
  })) << "the signal came before the time was over";
}

}  // namespace
}  // namespace kel::platform
