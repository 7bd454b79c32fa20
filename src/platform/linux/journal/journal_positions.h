#pragma once

#include <string>
#include <vector>

#include "platform/event_journal.h"
#include "platform/file_system.h"
#include "platform/system_log.h"

// Which positions may be given out, and which that come back can be answered for.
//
// Positions are numbers of a private counter. A process begins behind all that earlier ones reserved, and
// behind a gap of random width, and reserves a block for itself on the disk before it gives any out. So a
// process that knows nothing of another one, because the state directory was restored to what it had been
// before, uses other numbers, and what the other one gave out is in no range that is known here: "wrapped".
//
// Of the ranges that were used, the file tells up to where a later process may trust them: up to a position
// with which the index file on the disk is complete. A position becomes trusted when an index was written
// after it was given, or when nothing had changed since the last one was. An answer may tell of what that
// index does not hold. Whoever asked then knows more than the next process could find out, since the disk may
// be as before by then: so nothing is trusted any more before such an answer goes out, until a newer index is
// there.
//
// Never happens: two processes that give out the same position (the block is reserved before, or none is
// given out); a trusted position whose index is missing (the index is written first, and names itself in the
// file).
namespace kel::platform {

/// The journal's counter and the position file (see docs/journal.md). Used by one thread at a time. Borrows
/// `files` and `log`.
class JournalPositions {
 public:
  /// An absent `path`, an empty string: nothing outlasts the process, and no position is given out.
  JournalPositions(FileSystem& files, SystemLog& log, std::string path);

  /// Reads the file and begins a new range, behind `indexID`, the newest position of the index file, 0 when
  /// there is none. False when the index must not be used: it is newer than anything the file knows.
  bool open(EventID indexID);

  EventID last() const { return last_; }

  /// The position of the next event.
  EventID next() { return ++last_; }

  /// Makes sure that positions up to the last one may be given out; false when that cannot be had now.
  bool reserve();

  /// True when `position` was given out by this process or by one that is trusted.
  bool isKnown(EventID position) const;

  /// An index of which `indexID` is the newest position is on the disk, and nothing that it lacks happened
  /// before `upTo`. False when that could not be written down.
  bool trust(EventID indexID, EventID upTo);

  /// An answer is about to tell of events up to `event`. False when the index on the disk lacks some, and
  /// that it is not to be trusted could not be written down.
  bool tell(EventID event);

  EventID trusted() const { return trusted_; }

 private:
  struct Range {
    EventID first = 0;
    EventID last = 0;
  };

  bool write(bool withRanges);

  FileSystem& files_;
  SystemLog& log_;
  const std::string path_;
  std::vector<Range> earlier_;  // of earlier processes, in order
  EventID first_ = 0;
  EventID last_ = 0;
  EventID indexID_ = 0;  // of the index on the disk
  EventID trusted_ = 0;  // of this process' range, when the file has it
  EventID told_ = 0;     // the newest event that was told
  bool isReserved_ = false;
  bool hasRanges_ = false;  // the file on the disk trusts something
  bool failureReported_ = false;
};

}  // namespace kel::platform
