#include "platform/linux/journal/journal_keeper.h"

#include <algorithm>
#include <utility>

#include "platform/linux/files/sealed_bytes.h"
#include "platform/linux/journal/journal_index.h"

namespace kel::platform {

namespace {

using Clock = std::chrono::steady_clock;
using LookMode = JournalForest::LookMode;

constexpr std::string_view positionFormat = "kel journal position 2";

}  // namespace

JournalKeeper::JournalKeeper(std::vector<WatchedRoot> roots, const JournalOptions& options, FileSystem& files,
                             SystemLog& log, ConcurrentQueue& pool)
    : options_(options),
      roots_(std::move(roots)),
      files_(files),
      log_(log),
      forest_(
          roots_, options.limits, [this] { return newID(); }, log, pool) {
  if (!options_.directory) return;
  indexPath_ = joinPath(*options_.directory, "journal");
  positionPath_ = joinPath(*options_.directory, "journal-position");
}

void JournalKeeper::open() {
  if (!keepsIndex()) return;
  const FileReading position = files_.read(positionPath_, 4096);
  auto reader = position.bytes ? ByteReader::open(*position.bytes, positionFormat) : std::nullopt;
  const EventID reserved = reader ? reader->number() : 0;
  const EventID lastTold = reader ? reader->number() : 0;
  // A position that large was never given out, and leaves no room for others.
  if (!reader || !reader->atEnd() || reserved > JournalTree::noHorizon / 2) {
    // Without it an index may be older than positions that were given out: events would get smaller ones.
    if (position.bytes) log_.write(positionPath_ + ": damaged, starting without a journal");
    files_.remove(indexPath_);
    return;
  }
  lastID_ = reserved;
  const FileReading file = files_.read(indexPath_, largestOwnFile);
  if (!file.bytes) return;
  auto index = decodeIndex(*file.bytes, roots_);
  if (!index) return log_.write(indexPath_ + ": damaged or of another version, starting without it");
  lastID_ = std::max(lastID_, index->lastID);
  forest_.restore(std::move(index->trees));
  savedEvent_ = latestEvent();
  if (index->lastID >= lastTold) return;
  // Who asked after it was written may know what it does not hold, and what is the same again by now.
  for (const auto& tree : forest_.trees()) tree->forgetBefore(lastID_);
}

EventID JournalKeeper::newID() {
  lastID_ = std::max(lastID_ + 1, static_cast<EventID>(std::max<std::int64_t>(options_.now(), 0)));
  return lastID_;
}

/// The index file is written now and then; positions are safe from being given out twice at once. The first
/// one that covers events which the index file does not hold is noted, too.
void JournalKeeper::reserve(EventID id) {
  constexpr EventID ahead = 600'000'000'000;
  const EventID latest = latestEvent();
  const bool tellsMore = latest > savedEvent_ && lastTold_ <= savedEvent_;
  if ((id <= reservedID_ && !tellsMore) || !keepsIndex()) return;
  if (id > reservedID_) reservedID_ = id + ahead;
  lastTold_ = latest;
  ByteWriter writer;
  writer.number(reservedID_);
  writer.number(lastTold_);
  if (const auto error = files_.writeAtomically(positionPath_, writer.sealed(positionFormat))) {
    if (!std::exchange(failureReported_, true)) log_.write("Cannot keep the journal's position: " + *error);
  }
}

EventID JournalKeeper::currentEventID() {
  settle(allTrees());
  const EventID id = newID();
  reserve(id);
  return id;
}

void JournalKeeper::settle(const std::vector<JournalTree*>& trees) {
  // An update asks several questions one after the other, and waits for all of them together.
  constexpr int questionsTogether = 4;
  constexpr int shareOfFurtherOnes = 25;
  const auto start = Clock::now();
  const bool wasLate = lastLate_ && start - *lastLate_ < questionsTogether * options_.longestLook;
  const auto deadline = start + options_.longestLook / (wasLate ? shareOfFurtherOnes : 1);
  forest_.readEvents();
  forest_.questionUncovered(trees);
  while (forest_.lookAtSome(trees, LookMode::InParallel, deadline)) {
  }
  if (!wasLate && Clock::now() > deadline) lastLate_ = Clock::now();
  noteHorizons();
}

void JournalKeeper::noteHorizons() {
  for (const auto& tree : forest_.trees()) {
    const bool isFirst = tree->horizon == JournalTree::noHorizon;
    if (isFirst && tree->pending.empty() && !tree->isTooLarge) tree->horizon = newID();
  }
}

std::vector<JournalEvent> JournalKeeper::eventsSince(EventID since, const std::vector<std::string>& paths,
                                                     bool watchesRoot) {
  if (since > lastID_) return {{paths.empty() ? "" : paths.front(), event_flags::eventIDsWrapped, lastID_}};
  std::vector<JournalTree*> trees;
  for (const std::string& path : paths) {
    JournalTree* tree = treeOf(path);
    if (!tree) return {{path, event_flags::mustScanSubDirectories, lastID_}};
    if (std::find(trees.begin(), trees.end(), tree) == trees.end()) trees.push_back(tree);
  }
  settle(trees);
  std::vector<JournalEvent> events;
  for (const std::string& path : paths) {
    const JournalTree& tree = *treeOf(path);
    bool rootChanged = false;
    if (tree.knowsSince(since)) tree.addEvents(path, since, events, rootChanged);
    if (!tree.knowsSince(since) || (rootChanged && !watchesRoot)) {
      return {{path, event_flags::mustScanSubDirectories, lastID_}};
    }
  }
  return events;
}

bool JournalKeeper::lookInBackground() {
  forest_.readEvents();
  const bool isLeft =
      forest_.lookAtSome(allTrees(), LookMode::InBackground, Clock::now() + std::chrono::seconds(1));
  noteHorizons();
  return isLeft;
}

Bytes JournalKeeper::indexFile() {
  forest_.readEvents();
  forest_.questionUnsettled();
  while (forest_.lookAtSome(allTrees(), LookMode::ForGood, Clock::now() + std::chrono::seconds(1))) {
  }
  noteHorizons();
  // A record must not be newer than the events that are kept with it.
  forest_.readEvents();
  savedEvent_ = latestEvent();
  return encodeIndex(lastID_, forest_.trees());
}

std::vector<JournalTree*> JournalKeeper::allTrees() const {
  std::vector<JournalTree*> trees;
  for (const auto& tree : forest_.trees()) trees.push_back(tree.get());
  return trees;
}

JournalTree* JournalKeeper::treeOf(const std::string& path) const {
  JournalTree* found = nullptr;
  for (const auto& tree : forest_.trees()) {
    if (tree->covers(path) && (!found || found->path().size() < tree->path().size())) found = tree.get();
  }
  return found;
}

EventID JournalKeeper::latestEvent() const {
  EventID latest = 0;
  for (const auto& tree : forest_.trees()) {
    latest = std::max(latest, tree->root().latest);
    if (tree->horizon != JournalTree::noHorizon) latest = std::max(latest, tree->horizon);
  }
  return latest;
}

}  // namespace kel::platform
