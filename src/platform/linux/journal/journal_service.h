#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/event_journal.h"
#include "platform/file_system.h"
#include "platform/linux/files/owned_descriptor.h"
#include "platform/linux/journal/journal_forest.h"
#include "platform/linux/journal/journal_positions.h"
#include "platform/linux/queues/event_loop.h"
#include "platform/work_queue.h"

namespace kel::platform {

/// What the journal is made with.
struct JournalOptions {
  std::vector<std::string> applicationDirectories;  ///< watched beside those of the services
  std::optional<std::string> directory;  ///< for index and positions; absent: nothing outlasts the process
  JournalForest::Limits limits;
  std::chrono::milliseconds longestLook{5'000};      ///< per question; after that it cannot be told
  std::chrono::milliseconds betweenLooks{15'000};    ///< at what no event tells of
  std::chrono::milliseconds betweenSavings{1'000};   ///< at least
  std::chrono::milliseconds beforeFirstLook{1'000};  ///< whoever started us needs the processors more
};

/// The journal's thread: it reads the kernel's events, looks at what has to be looked at, answers and saves.
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

  /// Saves nothing: what ends the process may leave no time for that either.
  ~JournalService();

  /// `changed` is called, on the journal's thread, when something happens. Without one no earlier one is
  /// called once this has returned.
  void setChangeHandler(ChangeHandler changed);

  EventID currentEventID();

  /// The events under the paths after `since`, without history done. Where they cannot be told there is one
  /// that says so instead. `watchesRoot`: a root that was itself exchanged is told as such.
  std::vector<JournalEvent> eventsSince(EventID since, const std::vector<std::string>& paths,
                                        bool watchesRoot);

  /// The same, handed to `answer` on the journal's thread.
  void eventsSince(EventID since, std::vector<std::string> paths, bool watchesRoot,
                   std::function<void(std::vector<JournalEvent>)> answer);

  /// Looks at everything, and waits until what is known is on the disk: for measurements and tests. False
  /// when it could not be written.
  bool save();

  /// For measurements and tests.
  JournalForest::Size size();

 private:
  std::vector<JournalEvent> answer(EventID since, const std::vector<std::string>& paths, bool watchesRoot)
      KEL_RUNS_ON(queue_);
  void open() KEL_RUNS_ON(queue_);
  void openEvents() KEL_RUNS_ON(queue_);
  void lookForQuestion() KEL_RUNS_ON(queue_);
  void scheduleLook(std::chrono::nanoseconds delay) KEL_RUNS_ON(queue_);
  void lookInBackground() KEL_RUNS_ON(queue_);
  void lookFurther() KEL_RUNS_ON(queue_);
  void readEvents() KEL_RUNS_ON(queue_);
  void noteMounts() KEL_RUNS_ON(queue_);
  void doubtMounts() KEL_RUNS_ON(queue_);
  void finishRound() KEL_RUNS_ON(queue_);
  bool needsSaving() const KEL_RUNS_ON(queue_);
  void scheduleSaving() KEL_RUNS_ON(queue_);
  void beginSaving() KEL_RUNS_ON(queue_);
  void endSaving(EventID indexID, EventID event, std::optional<std::string> error) KEL_RUNS_ON(queue_);
  void after(std::chrono::nanoseconds delay, void (JournalService::*member)()) KEL_RUNS_ON(queue_);

  const JournalOptions options_;
  FileSystem& files_;
  SystemLog& log_;
  ConcurrentQueue& pool_;
  const std::string indexPath_;

  JournalPositions positions_ KEL_ON(queue_);
  JournalForest forest_ KEL_ON(queue_);
  OwnedDescriptor mounts_ KEL_ON(queue_);  // the kernel's table, -1 when it cannot be read
  ChangeHandler changed_ KEL_ON(queue_);
  std::unique_ptr<EventLoop::Watch> eventWatch_ KEL_ON(queue_);
  std::unique_ptr<EventLoop::Watch> mountWatch_ KEL_ON(queue_);
  bool hasLooked_ KEL_ON(queue_) = false;
  bool isLooking_ KEL_ON(queue_) = false;  // a look in the background is under way
  bool isLookingSoon_ KEL_ON(queue_) = false;
  std::uint64_t lookNumber_ KEL_ON(queue_) = 0;
  bool isClosing_ KEL_ON(queue_) = false;
  EventID lastGiven_ KEL_ON(queue_) = 0;
  EventID savedEvent_ KEL_ON(queue_) = 0;  // the newest event that the index on the disk holds
  EventID savedID_ KEL_ON(queue_) = 0;     // its newest position
  bool isSavingScheduled_ KEL_ON(queue_) = false;
  bool isWriting_ KEL_ON(queue_) = false;
  bool saveFailed_ KEL_ON(queue_) = false;
  bool failureReported_ KEL_ON(queue_) = false;
  std::chrono::steady_clock::time_point lastSaving_ KEL_ON(queue_);

  Group writing_;
  SerialQueue queue_;  // the last, so that it ends before what its tasks touch
};

}  // namespace kel::platform
