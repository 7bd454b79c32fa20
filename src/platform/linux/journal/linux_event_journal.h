#pragma once

#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/event_journal.h"
#include "platform/file_system.h"
#include "platform/linux/journal/change_log.h"
#include "platform/linux/journal/journal_service.h"
#include "platform/system_log.h"
#include "platform/work_queue.h"

namespace kel::platform {

/// The file-system event journal, of the directories it is told to watch: see docs/journal.md.
///
/// A question is answered from memory where the kernel's events tell all, and by comparing the disk with what
/// is remembered elsewhere; where neither can tell, the answer says so. Nothing is delivered after history
/// done: nobody listens. Any thread. Borrows `files`, `log` and `pool`, which outlive it.
class LinuxEventJournal final : public EventJournal, public ChangeLog {
 public:
  /// What changed, told as it happens; on the journal's own queue.
  using ChangeHandler = JournalService::ChangeHandler;

  LinuxEventJournal(JournalOptions options, FileSystem& files, SystemLog& log, ConcurrentQueue& pool);

  /// No stream and no other call may be left.
  ~LinuxEventJournal() override;

  /// A path that comes again is left out.
  void watch(const std::vector<std::string>& serviceDirectories) override;

  /// Begins to watch, in the background; `changed` is called for what happens from then on. Without this call
  /// the first question begins it. A further call without a handler ends that: none is called once
  /// it has returned. False when there is no thread to be had: then changes are not told, and no stream
  /// is made.
  bool start(ChangeHandler changed);

  /// The first one of a process waits for nothing but its reservation on the disk, later ones also, five
  /// seconds at most, for what has to be looked at. Safe to compare over restarts; 0 when it would not be.
  EventID currentEventID() override;

  std::unique_ptr<JournalStream> createStream(JournalCallback callback, const std::vector<std::string>& paths,
                                              EventID since, std::chrono::nanoseconds latency,
                                              std::uint32_t flags) override;

  bool changedSince(const std::vector<std::string>& paths, EventID since) override;

  /// Null when there is no thread for it.
  JournalService* service();

 private:
  const JournalOptions options_;
  FileSystem& files_;
  SystemLog& log_;
  ConcurrentQueue& pool_;
  std::vector<WatchedRoot> roots_;
  std::once_flag started_;
  std::unique_ptr<JournalService> service_;
};

}  // namespace kel::platform
