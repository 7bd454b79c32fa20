#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/linux/notifications/notification_store.h"
#include "platform/notification_seeds.h"
#include "platform/system_log.h"
#include "platform/work_queue.h"

namespace kel::platform {

/// An observation of one name through its store's directory.
///
/// Made and started on any thread, destroyed on `queue` or after it has ended. Borrows `log`, which outlives
/// it.
class DirectoryObservation final : public NotificationSeeds::Observation {
 public:
  DirectoryObservation(const NotificationStore& store, std::string name, SerialQueue& queue,
                       std::function<void()> posted, SystemLog& log);
  DirectoryObservation(const DirectoryObservation&) = delete;
  DirectoryObservation& operator=(const DirectoryObservation&) = delete;
  ~DirectoryObservation() override;

  /// From when this returns every post leads to a call. Once. Returns the error as one line, or absent.
  std::optional<std::string> start();

 private:
  class Watcher;

  const std::shared_ptr<Watcher> watcher_;
};

}  // namespace kel::platform
