// What the journal's answers are taken for.
//
// An update asks twice, about its directories and then about its bundles, and every question costs a replay
// of the journal. A path that is observed already, itself or a directory above it, is not asked about again.
// The answers pile up in two sets: the paths that changed, and those that the journal cannot tell the changes
// of and that need a full scan. For the second the paths asked about count, not those that the events name:
// an event says "somewhere here", and all that was asked lies under suspicion.
//
// All tests are plain tests of prefixes, in both directions. A path has changed when an element is a prefix
// of it; beneath a path lies every element that it is a prefix of. Directories end in "/", so that no
// neighbour with a longer name is meant.
//
// A replay that does not end in time leaves its paths observed and unchanged. That is a choice: to read every
// bundle again would make a slow machine slower, and the journal promises to answer in a third of that time.
// What it would have told is seen when it changes again, or when everything is read.
//
// Never happens: an answer that is read while it still arrives, because the request takes no more events once
// it has signalled; a stream that outlives its question, because every question stops its request before it
// returns.

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
