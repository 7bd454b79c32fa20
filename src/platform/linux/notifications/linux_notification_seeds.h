#pragma once

#include <atomic>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "platform/guarded.h"
#include "platform/linux/notifications/notification_store.h"
#include "platform/notification_seeds.h"
#include "platform/system_log.h"

namespace kel::platform {

/// The notification service over a directory of small files (see `NotificationStore`). Observers watch the
/// directory and compare the count of posts, so that any number of posts is seen, whichever process made
/// them, and a new state alone is none.
///
/// Any thread. Borrows `log`, which outlives it. The first failure of each kind of operation goes to the log.
class LinuxNotificationSeeds final : public NotificationSeeds {
 public:
  LinuxNotificationSeeds(std::string directory, SystemLog& log) : store_(std::move(directory)), log_(log) {}

  Token registerName(const std::string& name) override;
  std::uint64_t state(Token token) override;
  void setState(Token token, std::uint64_t state) override;
  void post(const std::string& name) override;

  /// Never null; an observation that the kernel refuses is silent, with a line in the log. A post that begins
  /// after this returned is never missed.
  [[nodiscard]] std::unique_ptr<Observation> observe(const std::string& name, SerialQueue& queue,
                                                     std::function<void()> posted) override;

 private:
  struct Names {
    std::vector<std::string> byToken;  // a token is its index
    std::map<std::string, Token> tokens;
  };

  std::optional<std::string> nameOf(Token token);
  void reportOnce(const std::string& error, std::atomic<bool>& reported);

  const NotificationStore store_;
  SystemLog& log_;
  Guarded<Names> names_;
  std::atomic<bool> readFailureReported_ = false;
  std::atomic<bool> writeFailureReported_ = false;
};

}  // namespace kel::platform
