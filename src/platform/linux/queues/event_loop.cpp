#include "platform/linux/queues/event_loop.h"

#include <algorithm>
#include <array>
#include <cassert>
#include <cerrno>
#include <limits>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <system_error>
#include <utility>

#include "platform/linux/queues/thread.h"

// Rounds. In each the thread takes everything that was queued so far, with the timers that are due behind it,
// runs it in order and then serves the descriptors that are ready, without waiting if it ran anything. What a
// task queues is for the next round: a queue that keeps itself busy still hears its descriptors, and they
// never starve its tasks either, as one round serves 32 events at most.
//
// Wake-ups. `asleep` is set, under the inbox's lock, by the thread that found nothing to do, and taken back
// by the first who brings something; only that one writes to the event descriptor. When the write comes
// before the thread has begun to wait it is still there to end the wait at once, so the gap between the two
// does no harm. A timer that is due later than the earliest wakes nobody.
//
// Watches. Each has a number of its own that goes into the kernel's event and is never used again. A callback
// may destroy any watch, while events for it may already have been fetched in the same call: they are looked
// up by number and found gone. The descriptor would not do as a key: closed and opened again it names another
// file. A callback that destroys its own watch goes on to its end, because the loop holds the callback while
// it runs.
//
// The end. When `finish` was called and nothing is queued the thread drops the rest, and tasks that come
// later are dropped where they come, so that what they hold is let go of at once. From then on the loop's
// things belong to whoever still holds them: `ended_` is set last, and read first by `assertCurrent`.
namespace kel::platform {

namespace {

constexpr std::uint64_t wakeUpIdentity = 0;

const EventLoop*& currentLoop() {
  thread_local const EventLoop* loop = nullptr;
  return loop;
}

OwnedDescriptor orThrow(int descriptor, const char* what) {
  if (descriptor < 0) throw std::system_error(errno, std::generic_category(), what);
  return OwnedDescriptor(descriptor);
}

/// Rounded up, so that a timer is due when the wait ends.
int millisecondsUntil(EventLoop::TimePoint deadline) {
  const auto rest =
      std::chrono::ceil<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now()).count();
  return static_cast<int>(std::clamp<long long>(rest, 0, std::numeric_limits<int>::max()));
}

}  // namespace

EventLoop::EventLoop(std::string label)
    : label_(std::move(label)),
      epoll_(orThrow(epoll_create1(EPOLL_CLOEXEC), "epoll_create1")),
      wakeUp_(orThrow(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK), "eventfd")) {
  if (!epollControl(EPOLL_CTL_ADD, wakeUp_.get(), EPOLLIN, wakeUpIdentity)) {
    throw std::system_error(errno, std::generic_category(), "epoll_ctl");
  }
}

void EventLoop::start() {
  thread_ = startThread(label_, [self = shared_from_this()] { self->run(); });
}

void EventLoop::finish() {
  inbox_.with([](Inbox& inbox) { inbox.finishing = true; });
  wake();
  if (isCurrent()) {
    thread_.detach();
  } else {
    thread_.join();
  }
}

void EventLoop::run() {
  currentLoop() = this;
  assertCurrent();
  for (;;) {
    Round round = nextRound();
    if (round.finished) break;
    for (Task& task : round.tasks) {
      task();
      task = nullptr;
    }
    serveDescriptors(round.waitMilliseconds);
  }
  dropEverything();
  ended_.store(true, std::memory_order_release);
  currentLoop() = nullptr;
}

EventLoop::Round EventLoop::nextRound() {
  return inbox_.with([](Inbox& inbox) {
    Round round;
    const TimePoint now = std::chrono::steady_clock::now();
    while (!inbox.timers.empty() && inbox.timers.begin()->first <= now) {
      inbox.tasks.push_back(std::move(inbox.timers.begin()->second));
      inbox.timers.erase(inbox.timers.begin());
    }
    round.tasks.swap(inbox.tasks);
    round.finished = inbox.finishing && round.tasks.empty();
    inbox.asleep = round.tasks.empty() && !round.finished;
    if (inbox.asleep) {
      round.waitMilliseconds = inbox.timers.empty() ? -1 : millisecondsUntil(inbox.timers.begin()->first);
    }
    return round;
  });
}

void EventLoop::serveDescriptors(int waitMilliseconds) {
  if (waitMilliseconds == 0 && callbacks_.empty()) return;
  std::array<epoll_event, 32> events;
  const int count =
      epoll_wait(epoll_.get(), events.data(), static_cast<int>(events.size()), waitMilliseconds);
  for (int i = 0; i < count; ++i) {
    const epoll_event& event = events[static_cast<std::size_t>(i)];
    const std::uint64_t id = event.data.u64;  // copied: the kernel's structure is packed
    if (id == wakeUpIdentity) {
      std::uint64_t wakeUps = 0;
      [[maybe_unused]] const ssize_t ignored = ::read(wakeUp_.get(), &wakeUps, sizeof wakeUps);
      continue;
    }
    const auto found = callbacks_.find(id);
    if (found == callbacks_.end()) continue;
    const std::shared_ptr<const Callback> callback = found->second;
    (*callback)(event.events);
  }
}

void EventLoop::dropEverything() {
  // What is destroyed may destroy watches or hand over tasks in turn, so it is let go of outside the inbox
  // and after the map is empty.
  const Inbox dropped = inbox_.with([](Inbox& inbox) {
    Inbox rest = std::exchange(inbox, {});
    inbox.ended = true;
    return rest;
  });
  const auto callbacks = std::exchange(callbacks_, {});
}

void EventLoop::async(Task task) {
  const bool mustWake = inbox_.with([&task](Inbox& inbox) {
    if (inbox.ended) return false;
    inbox.tasks.push_back(std::move(task));
    return std::exchange(inbox.asleep, false);
  });
  if (mustWake) wake();
}

void EventLoop::after(std::chrono::nanoseconds delay, Task task) {
  if (delay <= std::chrono::nanoseconds::zero()) return async(std::move(task));
  const TimePoint now = std::chrono::steady_clock::now();
  const TimePoint deadline = delay > TimePoint::max() - now ? TimePoint::max() : now + delay;
  const bool mustWake = inbox_.with([&](Inbox& inbox) {
    if (inbox.ended) return false;
    const auto timer = inbox.timers.emplace(deadline, std::move(task));
    return timer == inbox.timers.begin() && std::exchange(inbox.asleep, false);
  });
  if (mustWake) wake();
}

bool EventLoop::isCurrent() const { return currentLoop() == this; }

void EventLoop::assertCurrent() const { assert(isCurrent() || ended_.load(std::memory_order_acquire)); }

std::unique_ptr<EventLoop::Watch> EventLoop::watch(int descriptor, std::uint32_t events, Callback callback) {
  assertCurrent();
  const std::uint64_t id = ++lastWatch_;
  if (!epollControl(EPOLL_CTL_ADD, descriptor, events, id)) return nullptr;
  callbacks_.emplace(id, std::make_shared<const Callback>(std::move(callback)));
  return std::make_unique<Watch>(shared_from_this(), id, descriptor);
}

void EventLoop::change(std::uint64_t id, int descriptor, std::uint32_t events) {
  assertCurrent();
  epollControl(EPOLL_CTL_MOD, descriptor, events, id);
}

void EventLoop::unwatch(std::uint64_t id, int descriptor) {
  assertCurrent();
  epollControl(EPOLL_CTL_DEL, descriptor, 0, id);
  // Kept until after the erasure: the callback's destruction may come back here.
  const auto callback = callbacks_.extract(id);
}

bool EventLoop::epollControl(int operation, int descriptor, std::uint32_t events, std::uint64_t id) {
  epoll_event event{};
  event.events = events;
  event.data.u64 = id;
  return epoll_ctl(epoll_.get(), operation, descriptor, &event) == 0;
}

void EventLoop::wake() {
  const std::uint64_t one = 1;
  [[maybe_unused]] const ssize_t ignored = ::write(wakeUp_.get(), &one, sizeof one);
}

}  // namespace kel::platform
