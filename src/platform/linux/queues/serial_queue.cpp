#include <cassert>
#include <future>
#include <utility>

#include "platform/linux/queues/event_loop.h"
#include "platform/work_queue.h"

namespace kel::platform {

SerialQueue::SerialQueue(std::string label) : loop_(std::make_shared<EventLoop>(std::move(label))) {
  loop_->start();
}

SerialQueue::~SerialQueue() { loop_->finish(); }

const std::string& SerialQueue::label() const { return loop_->label(); }

void SerialQueue::async(Task task) { loop_->async(std::move(task)); }

void SerialQueue::sync(const Task& task) {
  assert(!isCurrent());
  std::promise<void> done;
  const std::future<void> finished = done.get_future();
  loop_->async([&] {
    // Moved here, so that the caller cannot wake up and destroy the promise while it is being kept.
    std::promise<void> kept = std::move(done);
    task();
    kept.set_value();
  });
  finished.wait();
}

void SerialQueue::after(std::chrono::nanoseconds delay, Task task) { loop_->after(delay, std::move(task)); }

bool SerialQueue::isCurrent() const { return loop_->isCurrent(); }

void SerialQueue::assertCurrent() const { assert(isCurrent()); }

EventLoop& SerialQueue::loop() { return *loop_; }

}  // namespace kel::platform
