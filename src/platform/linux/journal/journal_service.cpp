#include "platform/linux/journal/journal_service.h"

#include <algorithm>
#include <fcntl.h>
#include <poll.h>
#include <sys/epoll.h>
#include <utility>

#include "platform/linux/files/files.h"
#include "platform/linux/files/sealed_bytes.h"
#include "platform/linux/journal/journal_index.h"
#include "platform/linux/queues/serial_queue.h"

namespace kel::platform {

namespace {

using Clock = std::chrono::steady_clock;
using LookMode = JournalForest::LookMode;

// A storm of events is read in gulps, so that it costs a share of one processor at most.
constexpr std::chrono::milliseconds betweenGulps{20};
constexpr std::chrono::milliseconds beforeSaving{300};
constexpr std::chrono::milliseconds afterMount{500};

std::string inDirectory(const std::optional<std::string>& directory, const char* name) {
  return directory ? joinPath(*directory, name) : std::string();
}

}  // namespace

JournalService::JournalService(std::vector<WatchedRoot> roots, const JournalOptions& options,
                               FileSystem& files, SystemLog& log, ConcurrentQueue& pool)
    : options_(options),
      files_(files),
      log_(log),
      pool_(pool),
      indexPath_(inDirectory(options.directory, "journal")),
      positions_(files, log, inDirectory(options.directory, "journal-position")),
      forest_(
          std::move(roots), options.limits,
          [this] {
            queue_.assertCurrent();
            return positions_.next();
          },
          log, pool),
      mounts_(openFile(AT_FDCWD, "/proc/self/mountinfo", O_RDONLY)),
      queue_("kel Journal") {
  queue_.async([this] {
    queue_.assertCurrent();
    open();
  });
}

JournalService::~JournalService() {
  queue_.sync([this] {
    queue_.assertCurrent();
    isClosing_ = true;
    eventWatch_.reset();
    mountWatch_.reset();
  });
  writing_.wait();
}

void JournalService::setChangeHandler(ChangeHandler changed) {
  const bool isEnd = !changed;
  const auto set = [this, changed = std::move(changed)] {
    queue_.assertCurrent();
    changed_ = changed;
  };
  // Only an end is waited for: the queue may be reading the index.
  isEnd ? queue_.sync(set) : queue_.async(set);
}

EventID JournalService::currentEventID() {
  EventID id = 0;
  queue_.sync([&] {
    queue_.assertCurrent();
    // The first one is not waited for: what happened before it is told as if it had happened later.
    if (hasLooked_) lookForQuestion();
    id = positions_.next();
    if (positions_.reserve()) {
      lastGiven_ = id;
    } else {
      id = 0;
    }
    finishRound();
  });
  return id;
}

std::vector<JournalEvent> JournalService::eventsSince(EventID since, const std::vector<std::string>& paths,
                                                      bool watchesRoot) {
  std::vector<JournalEvent> events;
  queue_.sync([&] {
    queue_.assertCurrent();
    events = answer(since, paths, watchesRoot);
  });
  return events;
}

void JournalService::eventsSince(EventID since, std::vector<std::string> paths, bool watchesRoot,
                                 std::function<void(std::vector<JournalEvent>)> done) {
  queue_.async([this, since, paths = std::move(paths), watchesRoot, done = std::move(done)] {
    queue_.assertCurrent();
    done(answer(since, paths, watchesRoot));
  });
}

std::vector<JournalEvent> JournalService::answer(EventID since, const std::vector<std::string>& paths,
                                                 bool watchesRoot) {
  const std::string& first = paths.empty() ? std::string() : paths.front();
  if (!positions_.isKnown(since)) return {{first, event_flags::eventIDsWrapped, positions_.last()}};
  for (const std::string& path : paths) {
    if (!forest_.treeOf(path)) return {{path, event_flags::mustScanSubDirectories, positions_.last()}};
  }
  lookForQuestion();
  // Without its index no position is trusted either.
  if (!positions_.tell(forest_.latestEvent())) files_.remove(indexPath_), savedID_ = 0;
  finishRound();
  std::vector<JournalEvent> events;
  for (const std::string& path : paths) {
    const JournalTree& tree = *forest_.treeOf(path);
    bool rootChanged = false;
    const bool isKnown = tree.knowsSince(since);
    if (isKnown) tree.addEvents(path, since, events, rootChanged);
    if (!isKnown || (rootChanged && !watchesRoot)) {
      return {{path, event_flags::mustScanSubDirectories, positions_.last()}};
    }
  }
  return events;
}

void JournalService::open() {
  const FileReading file = indexPath_.empty() ? FileReading() : files_.read(indexPath_, largestOwnFile);
  auto index = file.bytes ? decodeIndex(*file.bytes, forest_.roots()) : std::nullopt;
  if (file.bytes && !index) log_.write(indexPath_ + ": damaged or of another version, starting without it");
  if (positions_.open(index ? index->lastID : 0) && index) {
    savedID_ = index->lastID;
    forest_.restore(std::move(index->trees));
    savedEvent_ = forest_.latestEvent();
  }
  if (mounts_) {
    mountWatch_ = eventLoop(queue_).watch(mounts_.get(), EPOLLPRI, [this](std::uint32_t) {
      queue_.assertCurrent();
      doubtMounts();
    });
  }
  scheduleLook(options_.beforeFirstLook);
}

/// An instance that was not to be had is tried for again, now and then.
void JournalService::openEvents() {
  if (!forest_.openEvents()) return;
  eventWatch_ = eventLoop(queue_).watch(forest_.eventDescriptor(), EPOLLIN, [this](std::uint32_t) {
    queue_.assertCurrent();
    readEvents();
  });
  if (!eventWatch_) log_.write("Cannot wait for changes of watched directories");
}

void JournalService::lookForQuestion() {
  const auto deadline = Clock::now() + options_.longestLook;
  noteMounts();
  openEvents();
  forest_.readEvents();
  forest_.doubtUncovered();
  while (forest_.lookAtSome(LookMode::InParallel, deadline)) {
  }
  hasLooked_ = hasLooked_ || !forest_.hasDoubts();
}

/// Instead of what was scheduled before.
void JournalService::scheduleLook(std::chrono::nanoseconds delay) {
  queue_.after(delay, [this, number = ++lookNumber_] {
    queue_.assertCurrent();
    if (number == lookNumber_ && !isLooking_) lookInBackground();
  });
}

void JournalService::lookInBackground() {
  isLooking_ = true;
  isLookingSoon_ = false;
  noteMounts();
  openEvents();
  forest_.doubtUncovered();
  lookFurther();
}

/// In portions, so that questions are answered in between.
void JournalService::lookFurther() {
  forest_.readEvents();
  if (!isClosing_ && forest_.lookAtSome(LookMode::InBackground, Clock::time_point::max())) {
    after({}, &JournalService::lookFurther);
  } else {
    isLooking_ = false;
    hasLooked_ = true;
    isLookingSoon_ = false;
    scheduleLook(options_.betweenLooks);
  }
  finishRound();
}

void JournalService::readEvents() {
  forest_.readEvents();
  finishRound();
  eventWatch_->setEvents(0);
  queue_.after(betweenGulps, [this] {
    queue_.assertCurrent();
    if (eventWatch_) eventWatch_->setEvents(EPOLLIN);
  });
}

/// A question may come before the loop has seen that the table changed.
void JournalService::noteMounts() {
  pollfd table{mounts_.get(), POLLPRI, 0};
  if (mounts_ && poll(&table, 1, 0) > 0) doubtMounts();
}

void JournalService::doubtMounts() {
  forest_.doubtEverything();
  if (!std::exchange(isLookingSoon_, true)) scheduleLook(afterMount);
}

/// After whatever may have found something.
void JournalService::finishRound() {
  const JournalForest::Hints hints = forest_.takeHints();
  if ((hints.services || hints.applications) && changed_) changed_(hints);
  scheduleSaving();
}

bool JournalService::needsSaving() const {
  return !indexPath_.empty() && hasLooked_ &&
         (forest_.latestEvent() > savedEvent_ || lastGiven_ > positions_.trusted());
}

void JournalService::scheduleSaving() {
  if (isSavingScheduled_ || isWriting_ || isClosing_ || !needsSaving()) return;
  isSavingScheduled_ = true;
  const auto pause = saveFailed_ ? options_.betweenLooks : options_.betweenSavings;
  after(std::max<Clock::duration>(std::min(beforeSaving, pause), lastSaving_ + pause - Clock::now()),
        &JournalService::beginSaving);
}

void JournalService::beginSaving() {
  isSavingScheduled_ = false;
  if (isWriting_ || isClosing_ || !needsSaving()) return;
  lastSaving_ = Clock::now();
  // A record must not be newer than the events that are kept with it.
  forest_.readEvents();
  const EventID event = forest_.latestEvent();
  const EventID id = positions_.last();
  if (event <= savedEvent_ && savedID_ != 0) {
    saveFailed_ = !positions_.trust(savedID_, id);
    return scheduleSaving();
  }
  isWriting_ = true;
  writing_.async(pool_, [this, id, event, bytes = encodeIndex(id, forest_.trees())] {
    queue_.async([this, id, event, error = files_.writeAtomically(indexPath_, bytes)] {
      queue_.assertCurrent();
      endSaving(id, event, error);
    });
  });
}

void JournalService::endSaving(EventID indexID, EventID event, std::optional<std::string> error) {
  isWriting_ = false;
  saveFailed_ = error.has_value();
  if (error) {
    if (!std::exchange(failureReported_, true)) log_.write("Cannot keep the journal's index: " + *error);
  } else {
    failureReported_ = false;
    savedID_ = indexID;
    savedEvent_ = event;
    saveFailed_ = !positions_.trust(indexID, indexID);
  }
  scheduleSaving();
}

void JournalService::after(std::chrono::nanoseconds delay, void (JournalService::*member)()) {
  queue_.after(delay, [this, member] { (this->*member)(); });
}

bool JournalService::save() {
  for (;;) {
    bool isDone = false;
    bool hasFailed = false;
    bool hasBegun = false;
    queue_.sync([&] {
      queue_.assertCurrent();
      lookForQuestion();
      hasBegun = !isWriting_;
      beginSaving();
      isDone = !needsSaving();
    });
    writing_.wait();
    queue_.sync([&] {
      queue_.assertCurrent();
      hasFailed = saveFailed_;
    });
    if (isDone || (hasBegun && hasFailed)) return isDone;
  }
}

JournalForest::Size JournalService::size() {
  JournalForest::Size size;
  queue_.sync([&] {
    queue_.assertCurrent();
    size = forest_.size();
  });
  return size;
}

}  // namespace kel::platform
