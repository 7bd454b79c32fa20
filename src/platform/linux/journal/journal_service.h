#pragma once

#include <atomic>
#include <chrono>
#include <functional>
#include <memory>
#include <vector>

#include "platform/event_journal.h"
#include "platform/linux/journal/journal_keeper.h"
#include "platform/linux/journal/journal_subscription.h"
#include "platform/linux/journal/mount_table.h"
#include "platform/linux/queues/event_loop.h"
#include "platform/work_queue.h"

namespace kel::platform {

/// The journal's thread: it reads the kernel's events, looks at what has to be looked at and answers.
///
/// Made and destroyed by one thread, not its own; the rest from any thread.
class JournalService {
 public:
  using ChangeHandler = std::function<void(JournalForest::Hints)>;

  /// Throws std::system_error when the system has no thread left.
  JournalService(std::vector<WatchedRoot> roots, const JournalOptions& options, FileSystem& files,
                 SystemLog& log, ConcurrentQueue& pool);
  JournalService(const JournalService&) = delete;
  JournalService& operator=(const JournalService&) = delete;
  ~JournalService();

  /// `changed` is called, on the journal's thread, when something happens. Without one no earlier one is
  /// called once this has returned.
  void setChangeHandler(ChangeHandler changed);

  EventID currentEventID();
  bool changedSince(const std::vector<std::string>& paths, EventID since);

  /// Delivers the past, history done, and then what happens until the subscription is closed.
  void subscribe(std::shared_ptr<JournalSubscription> subscription);

 private:
  /// A subscription and the position up to which its events were delivered.
  struct Reader {
    std::weak_ptr<JournalSubscription> subscription;
    EventID position = 0;
  };

  void open() KEL_RUNS_ON(queue_);
  void look() KEL_RUNS_ON(queue_);
  void lookFurther() KEL_RUNS_ON(queue_);
  void readEvents() KEL_RUNS_ON(queue_);
  void noteMounts() KEL_RUNS_ON(queue_);
  void doubtMounts() KEL_RUNS_ON(queue_);
  void scheduleLook() KEL_RUNS_ON(queue_);
  void lookAfter(std::chrono::nanoseconds pause) KEL_RUNS_ON(queue_);
  void finishRound() KEL_RUNS_ON(queue_);
  void deliverLive() KEL_RUNS_ON(queue_);
  void dropClosedReaders() KEL_RUNS_ON(queue_);
  void scheduleSaving() KEL_RUNS_ON(queue_);
  void save() KEL_RUNS_ON(queue_);

  const JournalOptions options_;
  FileSystem& files_;
  SystemLog& log_;
  ConcurrentQueue& pool_;

  JournalKeeper keeper_ KEL_ON(queue_);
  MountTable mounts_ KEL_ON(queue_);
  ChangeHandler changed_ KEL_ON(queue_);
  std::vector<Reader> readers_ KEL_ON(queue_);
  std::unique_ptr<EventLoop::Watch> eventWatch_ KEL_ON(queue_);
  std::unique_ptr<EventLoop::Watch> mountWatch_ KEL_ON(queue_);
  std::chrono::steady_clock::time_point lookStart_ KEL_ON(queue_);
  std::chrono::steady_clock::time_point lastSaving_ KEL_ON(queue_);
  std::chrono::steady_clock::duration lastLook_ KEL_ON(queue_){};
  bool isLooking_ KEL_ON(queue_) = false;  // or about to
  bool isSavingScheduled_ KEL_ON(queue_) = false;

  std::atomic<bool> isClosing_ = false;
  std::atomic<bool> isWriting_ = false;
  Group writing_;
  SerialQueue queue_;  // the last, so that it ends before what its tasks touch
};

}  // namespace kel::platform
