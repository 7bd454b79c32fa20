#include "platform/linux/journal/journal_service.h"

#include <algorithm>
#include <poll.h>
#include <sys/epoll.h>

#include "platform/linux/queues/serial_queue.h"

namespace kel::platform {

namespace {

using Clock = std::chrono::steady_clock;

// A storm of events is read in gulps, so that it costs a share of one processor at most.
constexpr std::chrono::milliseconds betweenGulps{20};

// What no event tells of is looked at again after a pause, for the sake of those who wait to be told.
constexpr std::chrono::seconds shortestPause{30};
constexpr int pausePerLook = 100;

constexpr std::chrono::seconds beforeFirstLook{1};
constexpr std::chrono::seconds beforeSaving{2};
constexpr std::chrono::seconds betweenSavings{60};

std::vector<std::string> pathsOf(const std::vector<WatchedRoot>& roots) {
  std::vector<std::string> paths;
  for (const WatchedRoot& root : roots) paths.push_back(root.path);
  return paths;
}

}  // namespace

JournalService::JournalService(std::vector<WatchedRoot> roots, const JournalOptions& options,
                               FileSystem& files, SystemLog& log, ConcurrentQueue& pool)
    : options_(options),
      files_(files),
      log_(log),
      pool_(pool),
      keeper_(roots, options, files, log, pool),
      mounts_(pathsOf(roots)),
      queue_("kel Journal") {
  queue_.async([this] {
    queue_.assertCurrent();
    open();
  });
}

JournalService::~JournalService() {
  writing_.wait();
  isClosing_ = true;
  queue_.sync([this] {
    queue_.assertCurrent();
    eventWatch_.reset();
    mountWatch_.reset();
    if (keeper_.keepsIndex() && keeper_.needsSaving()) save();
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
    noteMounts();
    id = keeper_.currentEventID();
    finishRound();
  });
  return id;
}

bool JournalService::changedSince(const std::vector<std::string>& paths, EventID since) {
  bool changed = true;
  queue_.sync([&] {
    queue_.assertCurrent();
    noteMounts();
    changed = !keeper_.eventsSince(since, paths, true).empty();
    finishRound();
  });
  return changed;
}

void JournalService::subscribe(std::shared_ptr<JournalSubscription> subscription) {
  queue_.async([this, subscription = std::move(subscription)] {
    queue_.assertCurrent();
    dropClosedReaders();
    noteMounts();
    std::vector<JournalEvent> events =
        keeper_.eventsSince(subscription->since(), subscription->paths(), subscription->watchesRoot());
    const EventID position = keeper_.lastID();
    events.push_back({{}, event_flags::historyDone, position});
    JournalSubscription::deliver(subscription, std::move(events));
    readers_.push_back({subscription, position});
    finishRound();
  });
}

void JournalService::open() {
  keeper_.open();
  EventLoop& loop = eventLoop(queue_);
  if (const int events = keeper_.forest().eventDescriptor(); events >= 0) {
    eventWatch_ = loop.watch(events, EPOLLIN, [this](std::uint32_t) {
      queue_.assertCurrent();
      readEvents();
    });
    if (!eventWatch_) log_.write("Cannot wait for changes of watched directories");
    if (mounts_.descriptor() >= 0) {
      mountWatch_ = loop.watch(mounts_.descriptor(), EPOLLPRI, [this](std::uint32_t) {
        queue_.assertCurrent();
        doubtMounts();
        finishRound();
      });
    }
  }
  // Whoever started the server waits for a first answer, which needs the processors more.
  isLooking_ = true;
  lookAfter(beforeFirstLook);
}

/// In portions, so that questions are answered in between.
void JournalService::lookFurther() {
  if (!isClosing_ && keeper_.lookInBackground()) {
    queue_.async([this] {
      queue_.assertCurrent();
      lookFurther();
    });
  } else {
    isLooking_ = false;
    lastLook_ = Clock::now() - lookStart_;
  }
  finishRound();
}

void JournalService::look() {
  lookStart_ = Clock::now();
  keeper_.questionUncovered();
  lookFurther();
}

void JournalService::scheduleLook() {
  if (isLooking_ || !keeper_.forest().needsLooks() || keeper_.forest().eventDescriptor() < 0) return;
  isLooking_ = true;
  lookAfter(std::max<Clock::duration>(shortestPause, pausePerLook * lastLook_));
}

void JournalService::lookAfter(std::chrono::nanoseconds pause) {
  queue_.after(pause, [this] {
    queue_.assertCurrent();
    look();
  });
}

void JournalService::readEvents() {
  keeper_.forest().readEvents();
  finishRound();
  eventWatch_->setEvents(0);
  queue_.after(betweenGulps, [this] {
    queue_.assertCurrent();
    if (eventWatch_) eventWatch_->setEvents(EPOLLIN);
  });
}

/// A question may come before the loop has seen that the table changed.
void JournalService::noteMounts() {
  pollfd table{mounts_.descriptor(), POLLPRI, 0};
  if (table.fd >= 0 && poll(&table, 1, 0) > 0) doubtMounts();
}

void JournalService::doubtMounts() {
  if (mounts_.hasChanged()) keeper_.forest().doubtEverything();
}

/// After whatever may have found something.
void JournalService::finishRound() {
  const JournalForest::Hints hints = keeper_.forest().takeHints();
  if ((hints.services || hints.applications) && changed_) changed_(hints);
  if (hints.services || hints.applications) {
    deliverLive();
    // The questions may have found more, which no event will announce again.
    if (!readers_.empty()) {
      queue_.after(betweenGulps, [this] {
        queue_.assertCurrent();
        finishRound();
      });
    }
  }
  scheduleLook();
  scheduleSaving();
}

void JournalService::deliverLive() {
  dropClosedReaders();
  for (Reader& reader : readers_) {
    const auto subscription = reader.subscription.lock();
    if (!subscription) continue;
    std::vector<JournalEvent> events =
        keeper_.eventsSince(reader.position, subscription->paths(), subscription->watchesRoot());
    reader.position = keeper_.lastID();
    JournalSubscription::deliver(subscription, std::move(events));
  }
}

void JournalService::dropClosedReaders() {
  std::erase_if(readers_, [](const Reader& reader) {
    const auto subscription = reader.subscription.lock();
    return !subscription || !subscription->hasQueue();
  });
}

void JournalService::scheduleSaving() {
  if (isSavingScheduled_ || !keeper_.keepsIndex() || !keeper_.needsSaving()) return;
  isSavingScheduled_ = true;
  const auto earliest = lastSaving_ + betweenSavings - Clock::now();
  queue_.after(std::max<Clock::duration>(beforeSaving, earliest), [this] {
    queue_.assertCurrent();
    isSavingScheduled_ = false;
    if (keeper_.needsSaving()) save();
  });
}

void JournalService::save() {
  // One at a time, so that the newest is the last. It is not waited for: what it runs on may wait for us.
  if (isWriting_.exchange(true)) return scheduleSaving();
  lastSaving_ = Clock::now();
  writing_.async(pool_, [this, path = keeper_.indexPath(), bytes = keeper_.indexFile()] {
    if (const auto error = files_.writeAtomically(path, bytes)) {
      log_.write("Cannot keep the journal's index: " + *error);
    }
    isWriting_ = false;
  });
}

}  // namespace kel::platform
