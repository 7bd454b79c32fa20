#pragma once

#include <set>
#include <string>
#include <vector>

#include "common/path_set.h"
#include "platform/clock.h"
#include "platform/event_journal.h"

namespace kel {

/// What changed on disk since an event ID, as far as one update of the data store asks: accumulates the
/// answers of the journal for the paths observed so far. All tests are plain string prefix tests.
///
/// Used by one thread at a time. Borrows the journal and the clock.
class KELPathChangesObserver {
 public:
  KELPathChangesObserver(platform::EventJournal& journal, platform::Clock& clock,
                         platform::EventID eventStreamID);

  /// Asks the journal about those of `paths` that no earlier call covered. Waits up to 15 seconds for the
  /// answer.
  void observeChangesUnderPaths(const std::vector<std::string>& paths);

  /// True when `path` equals or lies under a path that changed or that the journal cannot tell the changes
  /// of.
  bool pathChangedOrRequiresRescan(const std::string& path) const;

  /// The changed paths and the paths in need of a full scan that lie under `path`.
  std::set<std::string> changedPathsUnderPath(const std::string& path) const;

 private:
  platform::EventJournal& journal_;
  platform::Clock& clock_;
  PathSet observedPaths_;
  PathSet pathsRequiringFullScan_;
  PathSet changedPaths_;
  const platform::EventID eventStreamID_;
};

}  // namespace kel
