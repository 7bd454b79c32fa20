#pragma once

#include <cstdint>
#include <limits>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/event_journal.h"
#include "platform/linux/journal/entry_record.h"

// The records and the states that they are in.
//
// A root is a folder. A folder of services holds bundles: everything in it that is a directory or a link. A
// folder of applications holds bundles, whose names end in ".app", and further folders. A bundle holds one
// record, that of its information dictionary, also while there is none. Nothing deeper is remembered, because
// nothing deeper decides the list: a bundle of 5,000 files costs as much as one of two.
//
// A record is made Doubted, by the list of names in its folder or by the index file, and a look at the disk,
// the parent's before the child's, turns it into one of the others. It is Covered when a watch tells of
// whatever happens to it, and another watch, on its folder, of whatever takes its place. Else it is
// Uncovered: behind a link, on a file system that does not tell, or without a watch. An event makes a covered
// record Doubted, a question all uncovered ones, and a file system mounted or unmounted all there are. It is
// Gone when its name is, and is kept to be told until there are too many of them; when the name is back it is
// Doubted again.
//
// An event, or a look that finds any difference, stamps the record with a new position. So a question is
// answered by looking at what is doubted and picking what is stamped later than it asks about. Never happens:
// an answer while a record of its tree is doubted (it is "must scan" then), and a record that becomes Covered
// by a look that came before its watch (what fell in between would be lost).
namespace kel::platform {

enum class RecordState : std::uint8_t { Doubted, Covered, Uncovered, Gone };

enum class RecordRole : std::uint8_t { Folder, Bundle, Information };

/// A directory that is watched.
struct WatchedRoot {
  std::string path;                ///< ends in "/"
  bool holdsApplications = false;  ///< else it holds services
};

class JournalTree;

/// One record and when it changed.
struct JournalNode {
  JournalTree* tree = nullptr;
  JournalNode* parent = nullptr;  ///< null for the root
  std::string_view name;          ///< lies in the parent's `children`
  RecordRole role = RecordRole::Folder;
  RecordState state = RecordState::Doubted;
  bool tells = false;   ///< its watch tells every change of it
  int watch = -1;       ///< the kernel's watch, -1 without one
  EventID changed = 0;  ///< when it appeared, vanished, was replaced or altered
  EventID listed = 0;   ///< of a folder: when names in it, or its attributes, last changed
  EventID latest = 0;   ///< the newest event at it or below it
  EntryRecord record;   ///< of a bundle's directory without times and size: what is in it has its own record
  std::map<std::string, std::unique_ptr<JournalNode>, std::less<>>
      children;  ///< those that are gone included
};

/// A name in a folder, as far as it decides anything.
struct ListedName {
  std::string name;
  EntryKind kind = EntryKind::Unknown;
};

/// The records of one watched root. Not locked; borrows nothing.
class JournalTree {
 public:
  static constexpr EventID noHorizon = std::numeric_limits<EventID>::max();
  static constexpr std::string_view informationName = "Info.plist";

  explicit JournalTree(WatchedRoot watchedRoot);
  JournalTree(const JournalTree&) = delete;
  JournalTree& operator=(const JournalTree&) = delete;

  const std::string& path() const { return watchedRoot_.path; }
  bool holdsApplications() const { return watchedRoot_.holdsApplications; }
  JournalNode& root() { return root_; }
  const JournalNode& root() const { return root_; }

  /// Without a trailing "/".
  std::string pathOf(const JournalNode& node) const;

  /// True when the list depends on the name's being in a folder of this tree.
  bool decides(std::string_view name, bool isDirectory) const;

  /// What is remembered of a name that decides; absent when it is only a name.
  std::optional<RecordRole> roleOf(const JournalNode& folder, const ListedName& name) const;

  /// Adds `name`, doubted, or brings it back when it was gone.
  JournalNode& add(JournalNode& parent, std::string_view name, RecordRole role);

  /// Turns the node into one that is gone, with nothing below it.
  void bury(JournalNode& node, EventID id);

  /// Gives up everything below the node.
  void clear(JournalNode& node);

  /// Forgets what is gone; events up to `newHorizon` can no longer be told.
  void forgetGone(EventID newHorizon);

  /// Notes an event at the node itself, or at the list of names in it.
  static void markChanged(JournalNode& node, EventID id);
  static void markListed(JournalNode& node, EventID id);

  /// True when `path`, with or without a trailing "/", is this root or lies below it.
  bool covers(std::string_view path) const;

  /// True when the events after `since` can be told.
  bool knowsSince(EventID since) const { return doubtedCount == 0 && !isTooLarge && since >= horizon; }

  /// Adds the events at and below `path`, which is covered, that are later than `since`; a root that was
  /// itself replaced is told as such in `rootChanged`.
  void addEvents(std::string_view path, EventID since, std::vector<JournalEvent>& events,
                 bool& rootChanged) const;

  EventID horizon = noHorizon;  ///< from which position on every event is known
  std::string chain;            ///< where the path leads, links followed; empty while it leads nowhere
  std::size_t nodeCount = 0;    ///< without the root
  std::size_t goneCount = 0;
  std::size_t doubtedCount = 1;
  bool isTooLarge = false;      ///< more records than are worth keeping
  bool approachChanged = true;  ///< the directories on the way to the root may be others

 private:
  void forgetGoneBelow(JournalNode& node);

  const WatchedRoot watchedRoot_;
  JournalNode root_;
};

}  // namespace kel::platform
