#include "platform/linux/notifications/linux_notification_seeds.h"

#include <cerrno>
#include <chrono>

#include "platform/linux/files/files.h"
#include "platform/linux/notifications/directory_observation.h"

namespace kel::platform {

namespace {

/// Where a name's count of posts starts: never where an earlier one, whose record was lost, had come to, so
/// that an observer sees the first post after the loss too.
std::uint64_t firstPost() {
  const auto now = std::chrono::system_clock::now().time_since_epoch();
  return static_cast<std::uint64_t>(std::chrono::duration_cast<std::chrono::nanoseconds>(now).count());
}

}  // namespace

NotificationSeeds::Token LinuxNotificationSeeds::registerName(const std::string& name) {
  return names_.with([&name](Names& names) {
    const auto [entry, isNew] = names.tokens.emplace(name, static_cast<Token>(names.byToken.size()));
    if (isNew) names.byToken.push_back(name);
    return entry->second;
  });
}

std::uint64_t LinuxNotificationSeeds::state(Token token) {
  const auto name = nameOf(token);
  if (!name) return 0;
  std::string error;
  const auto record = store_.read(*name, &error);
  if (!error.empty()) reportOnce(error, readFailureReported_);
  return record ? record->state : 0;
}

void LinuxNotificationSeeds::setState(Token token, std::uint64_t state) {
  const auto name = nameOf(token);
  if (!name) return;
  const auto error = store_.update(*name, [state](NotificationRecord& record) { record.state = state; });
  if (error) reportOnce(*error, writeFailureReported_);
}

void LinuxNotificationSeeds::post(const std::string& name) {
  const auto error = store_.update(name, [](NotificationRecord& record) {
    record.posts = record.posts == 0 ? firstPost() : record.posts + 1;
  });
  if (error) reportOnce(*error, writeFailureReported_);
}

std::unique_ptr<NotificationSeeds::Observation> LinuxNotificationSeeds::observe(
    const std::string& name, SerialQueue& queue, std::function<void()> posted) {
  auto observation = std::make_unique<DirectoryObservation>(store_, name, queue, std::move(posted), log_);
  if (const auto error = observation->start()) log_.write("Cannot watch notifications: " + *error);
  return observation;
}

std::optional<std::string> LinuxNotificationSeeds::nameOf(Token token) {
  return names_.with([token](const Names& names) {
    const bool isKnown = token >= 0 && static_cast<std::size_t>(token) < names.byToken.size();
    return isKnown ? std::optional(names.byToken[static_cast<std::size_t>(token)]) : std::nullopt;
  });
}

void LinuxNotificationSeeds::reportOnce(const std::string& error, std::atomic<bool>& reported) {
  if (!reported.exchange(true)) log_.write("Notification service: " + error);
}

}  // namespace kel::platform
