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
  void open();
  void look();
  void lookFurther();
  void readEvents();
  void noteMounts();
  void doubtMounts();
  void scheduleLook();
  void finishRound();
  void deliverLive();
  void scheduleSaving();
  void save();

  const JournalOptions options_;
  FileSystem& files_;
  SystemLog& log_;
  ConcurrentQueue& pool_;

  // Only on the queue.
  JournalKeeper keeper_;
  MountTable mounts_;
  ChangeHandler changed_;
  std::vector<std::weak_ptr<JournalSubscription>> subscriptions_;
  std::unique_ptr<EventLoop::Watch> eventWatch_;
  std::unique_ptr<EventLoop::Watch> mountWatch_;
  std::chrono::steady_clock::time_point lookStart_;
  std::chrono::steady_clock::time_point lastSaving_;
  std::chrono::steady_clock::duration lastLook_{};
  bool isLooking_ = false;  // or about to
  bool isSavingScheduled_ = false;

  std::atomic<bool> isClosing_ = false;
  std::atomic<bool> isWriting_ = false;
  Group writing_;
  SerialQueue queue_;
};

}  // namespace kel::platform
