#pragma once

#include <string>
#include <vector>

#include "platform/event_journal.h"

namespace kel::platform {

/// Tells whether anything below some directories changed. Any thread.
class ChangeLog {
 public:
  virtual ~ChangeLog() = default;

  /// A position: whatever changes from now on is later than it.
  virtual EventID currentEventID() = 0;

  /// False only when nothing below `paths` changed after `since`; true when something did or it cannot be
  /// told.
  virtual bool changedSince(const std::vector<std::string>& paths, EventID since) = 0;
};

}  // namespace kel::platform
