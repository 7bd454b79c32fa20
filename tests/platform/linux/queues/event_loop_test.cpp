#include "platform/linux/queues/event_loop.h"

#include <array>
#include <gtest/gtest.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>

#include "platform/linux/queues/serial_queue.h"

namespace kel::platform {
namespace {

TEST(EventLoopTest, ADescriptorRemovedByAnotherOnesCallbackIsNotServedEvenWhenItsEventWasFetched) {
  SerialQueue queue("watch");
  const OwnedDescriptor first(eventfd(1, EFD_CLOEXEC)), second(eventfd(1, EFD_CLOEXEC));
  std::array<std::unique_ptr<EventLoop::Watch>, 2> watches;
  int served = 0;
  const auto serve = [&](std::uint32_t) {
    ++served;
    watches = {};
  };
  queue.sync([&] {
    watches[0] = eventLoop(queue).watch(first.get(), EPOLLIN, serve);
    watches[1] = eventLoop(queue).watch(second.get(), EPOLLIN, serve);
  });
  for (int i = 0; i < 3; ++i) queue.sync([] {});
  queue.sync([&] { EXPECT_EQ(served, 1); });
}

}  // namespace
}  // namespace kel::platform
