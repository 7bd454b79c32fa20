#include "platform/linux/queues/serial_queue.h"

#include <cassert>
#include <future>
#include <utility>

namespace kel::platform {

namespace {

/// The depth of the queue that the calling thread works for; a thread that works for none may wait for all.
int& currentDepth() {
  thread_local int depth = std::numeric_limits<int>::min();
  return depth;
}

}  // namespace

struct SerialQueue::Body {
  const int depth;
  const std::shared_ptr<EventLoop> loop;
};

SerialQueue::SerialQueue(std::string label, int depth)
    : body_(new Body{depth, std::make_shared<EventLoop>(std::move(label))}) {
  body_->loop->async([depth] { currentDepth() = depth; });
  body_->loop->start();
}

SerialQueue::~SerialQueue() { body_->loop->finish(); }

const std::string& SerialQueue::label() const { return body_->loop->label(); }

void SerialQueue::async(Task task) { body_->loop->async(std::move(task)); }

void SerialQueue::sync(const Task& task) {
  assert(currentDepth() < body_->depth);
  std::promise<void> done;
  const std::future<void> finished = done.get_future();
  body_->loop->async([&] {
    // Moved here, so that the caller cannot wake up and destroy the promise while it is being kept.
    std::promise<void> kept = std::move(done);
    task();
    kept.set_value();
  });
  finished.wait();
}

void SerialQueue::after(std::chrono::nanoseconds delay, Task task) {
  body_->loop->after(delay, std::move(task));
}

bool SerialQueue::isCurrent() const { return body_->loop->isCurrent(); }

void SerialQueue::assertCurrent() const { assert(isCurrent()); }

EventLoop& eventLoop(SerialQueue& queue) { return *queue.body().loop; }

}  // namespace kel::platform
