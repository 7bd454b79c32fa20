#pragma once

#include <functional>
#include <string_view>

#include "platform/work_queue.h"

namespace kel::platform {

/// Posted when the application registry's database has changed.
inline constexpr const char* databaseChangeNotification = "com.orvex.AppRegistry.DatabaseChange";

/// The names of the streams.
namespace launch_streams {
inline constexpr const char* databaseChanges = "com.orvex.beacond.matching";
inline constexpr const char* seedingComplete = "com.orvex.broadcastd.matching";
inline constexpr const char* directoryChanges = "com.orvex.vigil.matching";
}  // namespace launch_streams

/// The streams through which the launcher forwards notifications to the server.
class LaunchEvents {
 public:
  virtual ~LaunchEvents() = default;

  /// Runs `handler` on `queue` for every event of the stream, and once at the start: what changed while no
  /// server ran is not told otherwise. An unknown stream never fires. One handler per stream; called before
  /// the main event loop is entered. `queue` outlives this object.
  virtual void setHandler(std::string_view stream, SerialQueue& queue, std::function<void()> handler) = 0;
};

}  // namespace kel::platform
