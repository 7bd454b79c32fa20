#pragma once

#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/event_journal.h"
#include "platform/file_system.h"
#include "platform/linux/journal/change_log.h"
#include "platform/linux/journal/journal_keeper.h"
#include "platform/system_log.h"
#include "platform/work_queue.h"

namespace kel::platform {

class JournalService;

/// The file-system event journal, of the directories it is told to watch: see docs/journal.md.
///
/// A question is answered from memory where the kernel's events tell all, and by comparing the disk with what
/// is remembered elsewhere; where neither can tell, the answer says so. Any thread. Borrows `files`, `log`
/// and `pool`, which outlive it.
class LinuxEventJournal final : public EventJournal, public ChangeLog {
 public:
  /// What changed, told as it happens; on the journal's own queue.
  using ChangeHandler = std::function<void(JournalForest::Hints)>;

  LinuxEventJournal(JournalOptions options, FileSystem& files, SystemLog& log, ConcurrentQueue& pool);

  /// Writes the index file when it lags behind. No stream and no other call may be left.
  ~LinuxEventJournal() override;

  /// A path that comes again is left out.
  void watch(const std::vector<std::string>& serviceDirectories) override;

  /// Begins to watch, in the background; `changed` is called for what happens from then on. Without this call
  /// the first question begins it. A further call without a handler ends that: none is called once
  /// it has returned. False when there is no thread to be had: then changes are not told, and no stream
  /// is made.
  bool start(ChangeHandler changed);

  /// Waits, five seconds at most, for what has to be looked at. Safe to compare over restarts.
  EventID currentEventID() override;

  std::unique_ptr<JournalStream> createStream(JournalCallback callback, const std::vector<std::string>& paths,
                                              EventID since, std::chrono::nanoseconds latency,
                                              std::uint32_t flags) override;

  bool changedSince(const std::vector<std::string>& paths, EventID since) override;

 private:
  class Stream;

  JournalService* service();

  const JournalOptions options_;
  FileSystem& files_;
  SystemLog& log_;
  ConcurrentQueue& pool_;
  std::vector<WatchedRoot> roots_;
  std::once_flag started_;
  std::unique_ptr<JournalService> service_;  // null when there is no thread for it
};

}  // namespace kel::platform
