#include "discovery/path_change_observation_request.h"

#include <chrono>
#include <utility>

namespace kel {

using platform::JournalEvent;
namespace event_flags = platform::event_flags;
namespace stream_flags = platform::stream_flags;

std::shared_ptr<KELPathChangeObservationRequest> KELPathChangeObservationRequest::init(
    platform::EventJournal& journal) {
  return std::shared_ptr<KELPathChangeObservationRequest>(new KELPathChangeObservationRequest(journal));
}

bool KELPathChangeObservationRequest::runWithPaths(const std::vector<std::string>& paths,
                                                   platform::EventID streamID, bool tryWatchingRoot) {
  // The stream owns its callback and so holds this request until `stop` releases it.
  auto callback = [self = shared_from_this()](const std::vector<JournalEvent>& events) {
    self->receive(events);
  };
  const std::uint32_t flags = stream_flags::pathObjects | (tryWatchingRoot ? stream_flags::watchRoot : 0);
  eventStream_ =
      journal_.createStream(std::move(callback), paths, streamID, std::chrono::nanoseconds::zero(), flags);
  if (!eventStream_) return false;
  queue_ = &journal_.streamQueue();
  eventStream_->setQueue(*queue_);
  if (!eventStream_->start()) {
    eventStream_->invalidate();
    eventStream_.reset();
    return false;
  }
  return true;
}

bool KELPathChangeObservationRequest::runWithPaths(const std::vector<std::string>& paths,
                                                   platform::EventID streamID) {
  return runWithPaths(paths, streamID, true) || runWithPaths(paths, streamID, false);
}

void KELPathChangeObservationRequest::receive(const std::vector<JournalEvent>& events) {
  queue_->assertCurrent();
  if (finished_) return;
  for (const JournalEvent& event : events) {
    if (event.flags & event_flags::eventIDsWrapped) {
      mustDoFullScan_ = eventIDsWrapped_ = finished_ = true;
    }
    if (event.flags & event_flags::historyDone) {
      finished_ = true;
    } else if (event.flags & event_flags::mustScanSubDirectories) {
      mustDoFullScan_ = finished_ = true;
    } else {
      changedSubpaths_.insert(event.path);
    }
  }
  if (finished_) waiter_.signal();
}

void KELPathChangeObservationRequest::stop() {
  if (!eventStream_) return;
  queue_->sync([this] {
    eventStream_->stop();
    eventStream_->invalidate();
  });
  eventStream_.reset();
}

}  // namespace kel
