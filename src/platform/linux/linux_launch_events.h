#pragma once

#include <memory>
#include <vector>

#include "platform/launch_events.h"
#include "platform/notification_seeds.h"
#include "platform/system_log.h"

namespace kel::platform {

/// The event streams, from this machine's own sources:
/// - "com.orvex.beacond.matching": posts of "com.orvex.AppRegistry.DatabaseChange";
/// - "com.orvex.broadcastd.matching": the end of the application registry's seeding, which is over by the
/// time
///   the server starts: the event at the start is all there is;
/// - "com.orvex.vigil.matching": changes of watched files while no server ran, told by the event at the
/// start.
///
/// The event at the start is queued when a handler is set, so it comes before everything queued later. Made
/// and used on the main thread; destroyed there or on the handlers' queue. Borrows `seeds` and `log`.
class LinuxLaunchEvents final : public LaunchEvents {
 public:
  LinuxLaunchEvents(NotificationSeeds& seeds, SystemLog& log) : seeds_(seeds), log_(log) {}
  LinuxLaunchEvents(const LinuxLaunchEvents&) = delete;
  LinuxLaunchEvents& operator=(const LinuxLaunchEvents&) = delete;
  ~LinuxLaunchEvents() override;

  void setHandler(std::string_view stream, SerialQueue& queue, std::function<void()> handler) override;

 private:
  struct Source {
    SerialQueue& queue;
    std::unique_ptr<NotificationSeeds::Observation> observation;
  };

  NotificationSeeds& seeds_;
  SystemLog& log_;
  std::vector<Source> sources_;
};

}  // namespace kel::platform
