#pragma once

#include <functional>
#include <memory>
#include <vector>

#include "platform/launch_events.h"
#include "platform/linux/journal/linux_event_journal.h"
#include "platform/linux/registry/linux_application_registry.h"
#include "platform/notification_seeds.h"
#include "platform/system_log.h"

namespace kel::platform {

/// The event streams, from this machine's own sources:
/// - `databaseChanges`: posts of the database's notification, which changes below the application directories
///   lead to;
/// - `seedingComplete`: the end of the application registry's first scan;
/// - `directoryChanges`: changes below the directories that the journal watches.
///
/// The event at the start is queued when a handler is set, so it comes before everything queued later. The
/// registry's scan and the watching begin with the handlers of their streams. Made and used on the main
/// thread; destroyed there or on the handlers' queue. Borrows everything it is given.
class LinuxLaunchEvents final : public LaunchEvents {
 public:
  LinuxLaunchEvents(NotificationSeeds& seeds, SystemLog& log, LinuxEventJournal& journal,
                    LinuxApplicationRegistry& applications)
      : seeds_(seeds), log_(log), journal_(journal), applications_(applications) {}
  LinuxLaunchEvents(const LinuxLaunchEvents&) = delete;
  LinuxLaunchEvents& operator=(const LinuxLaunchEvents&) = delete;
  ~LinuxLaunchEvents() override;

  void setHandler(std::string_view stream, SerialQueue& queue, std::function<void()> handler) override;

 private:
  struct Source {
    SerialQueue& queue;
    std::unique_ptr<NotificationSeeds::Observation> observation;
  };

  void watch(SerialQueue& queue, std::function<void()> handler);

  NotificationSeeds& seeds_;
  SystemLog& log_;
  LinuxEventJournal& journal_;
  LinuxApplicationRegistry& applications_;
  bool isWatching_ = false;
  std::vector<Source> sources_;
};

}  // namespace kel::platform
