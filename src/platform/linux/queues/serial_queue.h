#pragma once

#include "platform/linux/queues/event_loop.h"
#include "platform/work_queue.h"

namespace kel::platform {

/// The loop of the queue's thread, for the event sources of the other rooms. As long as the queue lives.
EventLoop& eventLoop(SerialQueue& queue);

}  // namespace kel::platform
