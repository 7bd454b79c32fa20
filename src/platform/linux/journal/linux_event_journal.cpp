#include "platform/linux/journal/linux_event_journal.h"

#include <algorithm>
#include <system_error>
#include <utility>

#include "platform/guarded.h"

namespace kel::platform {

namespace {

/// One reader of the journal. Its callback runs on its own queue, and never after `close`.
struct Reader {
  explicit Reader(JournalCallback toCall) : callback(std::move(toCall)) {}

  const JournalCallback callback;
  Guarded<SerialQueue*> queue;  // null when it is closed, or has not been opened

  static void deliver(const std::shared_ptr<Reader>& reader, std::vector<JournalEvent> events) {
    // Handed over while the reader cannot be closed: its queue is still there.
    reader->queue.with([&](SerialQueue* open) {
      if (!open) return;
      open->async([reader, events = std::move(events)] {
        if (reader->queue.copy()) reader->callback(events);
      });
    });
  }
};

class Stream final : public JournalStream {
 public:
  Stream(JournalService& service, JournalCallback callback, std::vector<std::string> paths, EventID since,
         bool watchesRoot)
      : service_(service),
        reader_(std::make_shared<Reader>(std::move(callback))),
        paths_(std::move(paths)),
        since_(since),
        watchesRoot_(watchesRoot) {}
  ~Stream() override { invalidate(); }

  void setQueue(SerialQueue& queue) override { reader_->queue.set(&queue); }

  bool start() override {
    if (!reader_->queue.copy()) return false;
    service_.eventsSince(since_, paths_, watchesRoot_, [reader = reader_](std::vector<JournalEvent> events) {
      events.push_back({{}, event_flags::historyDone, 0});
      Reader::deliver(reader, std::move(events));
    });
    return true;
  }

  void stop() override { reader_->queue.set(nullptr); }
  void invalidate() override { reader_->queue.set(nullptr); }

 private:
  JournalService& service_;
  const std::shared_ptr<Reader> reader_;
  const std::vector<std::string> paths_;
  const EventID since_;
  const bool watchesRoot_;
};

}  // namespace

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
  return running ? running->currentEventID() : 0;
}

std::unique_ptr<JournalStream> LinuxEventJournal::createStream(JournalCallback callback,
                                                               const std::vector<std::string>& paths,
                                                               EventID since, std::chrono::nanoseconds,
                                                               std::uint32_t flags) {
  JournalService* const running = service();
  if (!running) return nullptr;
  return std::make_unique<Stream>(*running, std::move(callback), paths, since,
                                  (flags & stream_flags::watchRoot) != 0);
}

bool LinuxEventJournal::changedSince(const std::vector<std::string>& paths, EventID since) {
  JournalService* const running = service();
  return !running || !running->eventsSince(since, paths, true).empty();
}

}  // namespace kel::platform
