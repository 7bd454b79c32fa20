#pragma once

#include <memory>
#include <set>
#include <string>
#include <vector>

#include "platform/event_journal.h"
#include "platform/work_queue.h"

namespace kel {

/// One run of the file-system event journal over some paths: replays the history since an event ID, gathers
/// the changed paths and tells when the history is done.
///
/// Made with `init`, run once, by one thread. An open stream keeps the request alive until `stop`, which must
/// be called before the request is given up. Borrows the journal.
class KELPathChangeObservationRequest : public std::enable_shared_from_this<KELPathChangeObservationRequest> {
 public:
  static std::shared_ptr<KELPathChangeObservationRequest> init(platform::EventJournal& journal);

  /// Opens a stream over `paths` from `streamID`; false when none could be created and started.
  bool runWithPaths(const std::vector<std::string>& paths, platform::EventID streamID, bool tryWatchingRoot);

  /// As above, watching the roots if the journal can, else without.
  bool runWithPaths(const std::vector<std::string>& paths, platform::EventID streamID);

  /// Closes the stream, if there is one: no event arrives afterwards. Not from the request's own queue.
  void stop();

  /// Signalled once, when the run has finished.
  platform::Semaphore& waiter() { return waiter_; }

  // The results; to be read only after `waiter` was signalled.
  const std::set<std::string>& changedSubpaths() const { return changedSubpaths_; }
  bool mustDoFullScan() const { return mustDoFullScan_; }
  bool eventIDsWrapped() const { return eventIDsWrapped_; }

 private:
  explicit KELPathChangeObservationRequest(platform::EventJournal& journal) : journal_(journal) {}
  void receive(const std::vector<platform::JournalEvent>& events);

  platform::EventJournal& journal_;
  std::unique_ptr<platform::JournalStream> eventStream_;
  platform::SerialQueue* queue_ = nullptr;  // the journal's; null before the stream is made
  platform::Semaphore waiter_;

  // Written on queue_ until the semaphore is signalled, read by the waiting thread afterwards.
  std::set<std::string> changedSubpaths_;
  bool finished_ = false;
  bool mustDoFullScan_ = false;
  bool eventIDsWrapped_ = false;
};

}  // namespace kel
