#pragma once

#include <functional>
#include <memory>
#include <utility>

#include "platform/linux/queues/event_loop.h"

namespace kel::platform {

/// A callback for a source that may outlive the object it calls (a timer, a watch, a queued task): does
/// nothing when the object is gone, else states that it runs on `loop` and calls `member` with `bound` and,
/// unless the member takes nothing further, what the source passes.
///
/// The object is kept while the member runs, and keeps `loop`. A `member` marked `KEL_RUNS_ON(loop)` is
/// thereby entered as it demands: no other place hands it to a source.
template <typename Object, typename... Parameters, typename... Bound>
auto whileAlive(std::weak_ptr<Object> weak, const EventLoop& loop, void (Object::*member)(Parameters...),
                Bound... bound) {
  return [=, &loop, weak = std::move(weak)]<typename... Passed>(Passed&&... passed) {
    const auto object = weak.lock();
    if (!object) return;
    loop.assertCurrent();
    if constexpr (sizeof...(Parameters) == sizeof...(Bound)) {
      std::invoke(member, *object, bound...);
    } else {
      std::invoke(member, *object, bound..., std::forward<Passed>(passed)...);
    }
  };
}

}  // namespace kel::platform
