#include "discovery/path_changes_observer.h"

#include <chrono>
#include <optional>

#include "common/common.h"
#include "discovery/path_change_observation_request.h"

namespace kel {

namespace {

constexpr std::chrono::nanoseconds longestReplay = std::chrono::seconds(15);

void insertAll(PathSet& set, const auto& paths) {
  for (const std::string& path : paths) set.insert(path);
}

}  // namespace

KELPathChangesObserver::KELPathChangesObserver(platform::EventJournal& journal, platform::Clock& clock,
                                               platform::EventID eventStreamID)
    : journal_(journal), clock_(clock), eventStreamID_(eventStreamID) {}

void KELPathChangesObserver::observeChangesUnderPaths(const std::vector<std::string>& paths) {
  const std::vector<std::string> kept = map_array(paths, [this](const std::string& path) {
    return observedPaths_.holdsPrefixOf(path) ? std::nullopt : std::optional(path);
  });
  if (kept.empty()) return;
  send_debug_line([&] { return "Looking for changes under paths:\n\t" + join(kept, "\n\t"); });

  const auto request = KELPathChangeObservationRequest::init(journal_);
  if (!request->runWithPaths(kept, eventStreamID_)) {
    send_debug_line([] { return "VigilStream failed!"; });
    insertAll(pathsRequiringFullScan_, kept);
  } else if (!clock_.wait(request->waiter(), longestReplay)) {
    send_debug_line([] { return "Vigil didn't finish after 15 seconds!"; });
  } else if (request->mustDoFullScan() || request->eventIDsWrapped()) {
    send_debug_line([] { return "Vigil says we must do a full scan"; });
    insertAll(pathsRequiringFullScan_, kept);
  } else if (const std::set<std::string>& changed = request->changedSubpaths(); !changed.empty()) {
    send_debug_line([&] { return "Changed subpaths:\n\t" + join({changed.begin(), changed.end()}, "\n\t"); });
    insertAll(changedPaths_, changed);
  } else {
    send_debug_line([] { return "No changes!"; });
  }
  request->stop();
  insertAll(observedPaths_, kept);
}

bool KELPathChangesObserver::pathChangedOrRequiresRescan(const std::string& path) const {
  return pathsRequiringFullScan_.holdsPrefixOf(path) || changedPaths_.holdsPrefixOf(path);
}

std::set<std::string> KELPathChangesObserver::changedPathsUnderPath(const std::string& path) const {
  std::set<std::string> found;
  changedPaths_.addElementsUnder(path, found);
  pathsRequiringFullScan_.addElementsUnder(path, found);
  return found;
}

}  // namespace kel
