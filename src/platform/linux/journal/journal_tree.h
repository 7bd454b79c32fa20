#pragma once

#include <cstdint>
#include <functional>
#include <limits>
#include <list>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/event_journal.h"
#include "platform/linux/journal/entry_record.h"

namespace kel::platform {

class JournalTree;
struct JournalNode;

/// A directory that is watched with everything below it.
struct WatchedRoot {
  std::string path;                ///< ends in "/"
  bool holdsApplications = false;  ///< else it holds services
};

/// What is remembered of a directory, or of a link that leads to one.
struct JournalDirectory {
  std::map<std::string, std::unique_ptr<JournalNode>, std::less<>> children;  ///< vanished ones included
  EntryStatus listing;           ///< its own status, from before it was last listed; unknown: never
  bool listingIsSound = false;   ///< a directory of that status holds just these names
  int error = 0;                 ///< why it could not be listed
  std::uint64_t fileSystem = 0;  ///< identity of its file system, as far as that has one
  bool notifies = false;         ///< every change of it is told by its watch
  EventID listed = 0;            ///< when names in it, or its attributes, last changed
  int watch = -1;                ///< the kernel's watch, -1 without one
};

/// One entry of a watched directory and when it changed.
struct JournalNode {
  JournalTree* tree = nullptr;
  JournalNode* parent = nullptr;  ///< null for the root
  std::string_view name;          ///< lies in the parent's `children`
  EntryRecord record;
  std::unique_ptr<JournalDirectory> directory;  ///< when the record leads to a directory
  EventID changed = 0;                          ///< when it appeared, vanished, was replaced or altered
  EventID latest = 0;                           ///< the newest event at it or below it
  bool isGone = false;                          ///< it vanished; kept to be told
  bool isBoundless = false;                     ///< a link to more than is worth following: always changed
  bool isDoubted = false;                       ///< it may have changed untold since its record was taken
  std::optional<std::list<JournalNode*>::iterator> pending;  ///< its place among those to be looked at
};

/// The link above everything else on the way to the node, itself included; null when there is none.
JournalNode* outermostLink(JournalNode& node);

/// What is remembered of one watched root and everything below it. Not locked; borrows nothing.
class JournalTree {
 public:
  static constexpr EventID noHorizon = std::numeric_limits<EventID>::max();

  explicit JournalTree(WatchedRoot watchedRoot);
  JournalTree(const JournalTree&) = delete;
  JournalTree& operator=(const JournalTree&) = delete;

  const std::string& path() const { return watchedRoot_.path; }
  bool holdsApplications() const { return watchedRoot_.holdsApplications; }
  JournalNode& root() { return root_; }
  const JournalNode& root() const { return root_; }

  /// Without a trailing "/".
  std::string pathOf(const JournalNode& node) const;

  /// Adds `name`, or brings it back when it had vanished.
  JournalNode& add(JournalNode& directory, std::string_view name, EntryRecord record);

  /// Turns the node into a vanished one, with nothing below it.
  void bury(JournalNode& node, EventID id);

  /// Gives up everything below the node.
  void clear(JournalNode& node);

  /// Events up to `newHorizon` can no longer be told.
  void forgetBefore(EventID newHorizon);

  /// Forgets what vanished; events up to `newHorizon` can no longer be told.
  void forgetVanished(EventID newHorizon);

  /// Notes an event at the node itself, or at the list of names in it.
  static void markChanged(JournalNode& node, EventID id);
  static void markListed(JournalNode& node, EventID id);

  /// True when `path`, with or without a trailing "/", is this root or lies below it.
  bool covers(std::string_view path) const;

  /// True when the events after `since` can be told.
  bool knowsSince(EventID since) const { return pending.empty() && !isTooLarge && since >= horizon; }

  /// Adds the events at and below `path`, which is covered, that are later than `since`; a root that was
  /// itself replaced is told as such in `rootChanged`.
  void addEvents(std::string_view path, EventID since, std::vector<JournalEvent>& events,
                 bool& rootChanged) const;

  EventID horizon = noHorizon;      ///< from which position on every event is known
  std::list<JournalNode*> pending;  ///< nodes to be looked at, in that order
  std::size_t nodeCount = 0;        ///< without the root
  std::size_t vanishedCount = 0;
  bool isTooLarge = false;      ///< more entries than are worth remembering
  bool approachChanged = true;  ///< the directories on the way to the root may be others
  std::uint64_t device = 0;     ///< where the root was last found, to notice another one in its place
  std::uint64_t inode = 0;

 private:
  void forgetVanishedBelow(JournalNode& node);

  const WatchedRoot watchedRoot_;
  JournalNode root_;
};

}  // namespace kel::platform
