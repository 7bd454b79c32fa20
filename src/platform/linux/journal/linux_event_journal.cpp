#include "platform/linux/journal/linux_event_journal.h"

#include <algorithm>
#include <system_error>
#include <utility>

#include "platform/linux/journal/journal_service.h"
#include "platform/linux/journal/journal_subscription.h"

namespace kel::platform {

class LinuxEventJournal::Stream final : public JournalStream {
 public:
  Stream(JournalService& service, std::shared_ptr<JournalSubscription> subscription)
      : service_(service), subscription_(std::move(subscription)) {}
  ~Stream() override { subscription_->close(); }

  void setQueue(SerialQueue& queue) override { subscription_->setQueue(queue); }

  bool start() override {
    if (!subscription_->hasQueue()) return false;
    service_.subscribe(subscription_);
    return true;
  }

  void stop() override { subscription_->close(); }
  void invalidate() override { subscription_->close(); }

 private:
  JournalService& service_;
  const std::shared_ptr<JournalSubscription> subscription_;
};

LinuxEventJournal::LinuxEventJournal(JournalOptions options, FileSystem& files, SystemLog& log,
                                     ConcurrentQueue& pool)
    : options_(std::move(options)), files_(files), log_(log), pool_(pool) {}

LinuxEventJournal::~LinuxEventJournal() = default;

void LinuxEventJournal::watch(const std::vector<std::string>& serviceDirectories) {
  const auto add = [this](const std::string& path, bool holdsApplications) {
    const bool isNew = std::none_of(roots_.begin(), roots_.end(),
                                    [&path](const WatchedRoot& root) { return root.path == path; });
    if (isNew) roots_.push_back({path, holdsApplications});
  };
  for (const std::string& directory : serviceDirectories) add(directory, false);
  for (const std::string& directory : options_.applicationDirectories) add(directory, true);
}

bool LinuxEventJournal::start(ChangeHandler changed) {
  JournalService* const running = service();
  if (running) running->setChangeHandler(std::move(changed));
  return running != nullptr;
}

JournalService* LinuxEventJournal::service() {
  std::call_once(started_, [this] {
    try {
      service_ = std::make_unique<JournalService>(roots_, options_, files_, log_, pool_);
    } catch (const std::system_error& error) {
      log_.write(std::string("No event journal: ") + error.what());
    }
  });
  return service_.get();
}

EventID LinuxEventJournal::currentEventID() {
  JournalService* const running = service();
  return running ? running->currentEventID() : static_cast<EventID>(options_.now());
}

std::unique_ptr<JournalStream> LinuxEventJournal::createStream(JournalCallback callback,
                                                               const std::vector<std::string>& paths,
                                                               EventID since, std::chrono::nanoseconds,
                                                               std::uint32_t flags) {
  JournalService* const running = service();
  if (!running) return nullptr;
  return std::make_unique<Stream>(
      *running, std::make_shared<JournalSubscription>(std::move(callback), paths, since,
                                                      (flags & stream_flags::watchRoot) != 0));
}

bool LinuxEventJournal::changedSince(const std::vector<std::string>& paths, EventID since) {
  JournalService* const running = service();
  return !running || running->changedSince(paths, since);
}

}  // namespace kel::platform
