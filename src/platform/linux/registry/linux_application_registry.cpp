#include "platform/linux/registry/linux_application_registry.h"

#include <algorithm>
#include <utility>

#include "platform/linux/files/files.h"
#include "platform/linux/journal/entry_look.h"
#include "platform/linux/registry/application_information.h"

// What is remembered, from the cheapest answer to the dearest. The last scan is the answer itself, as long as
// the change log tells of nothing below the roots since the position that was taken before that scan.
// Outsiders are compared each time: applications and information dictionaries behind links, which change
// where no root is. Else the folders are listed, and each application looked at. The memory holds what its
// dictionary said and the status that it had then; with the same status now it is not read. The database is
// the memory on disk, for the next process.
//
// A look is settled when every later change of the dictionary must show in its status: the status could be
// had, the last change is longer ago than the file system's clock is coarse, and nothing changed while it was
// read. Only settled looks are remembered. One that is not, like a folder that could not be listed, leaves
// the answer good for this once: the scan keeps no position, so that the next query scans again.
//
// One scan runs at a time; who asks meanwhile waits and mostly finds it good enough. The database is written
// in the background, one write at a time and of the newest memory only.
//
// Never happens: an answer that is older than a change that came before the question (the position is from
// before the scan, so what changes during it counts as later); a dictionary that is taken for unchanged
// because two changes fell into one tick of the clock.
namespace kel::platform {

LinuxApplicationRegistry::LinuxApplicationRegistry(FileSystem& files, SystemLog& log, ConcurrentQueue& queue,
                                                   std::vector<std::string> roots,
                                                   const std::optional<std::string>& stateDirectory,
                                                   ChangeLog* changes)
    : files_(files),
      log_(log),
      queue_(queue),
      roots_(std::move(roots)),
      database_(stateDirectory ? std::optional(joinPath(*stateDirectory, "kel/applications")) : std::nullopt),
      changes_(changes) {}

LinuxApplicationRegistry::~LinuxApplicationRegistry() { background_.wait(); }

std::vector<std::string> LinuxApplicationRegistry::applicationDirectories(const std::string& home) {
  return {"/System/Applications/", "/Network/Applications/", "/Applications/",
          joinPath(home, "Applications/")};
}

RegisteredApplications LinuxApplicationRegistry::applications(std::uint32_t mask, std::uint32_t value) {
  const Scan last = current();
  RegisteredApplications result{{}, last.isWhole};
  for (const Application& application : *last.applications) {
    if ((application.flags & mask) == value) result.applications.push_back({application.path});
  }
  return result;
}

void LinuxApplicationRegistry::seed(std::function<void()> done) {
  background_.async(queue_, [this, done = std::move(done)] {
    current();
    done();
  });
}

LinuxApplicationRegistry::Scan LinuxApplicationRegistry::current() {
  const MutexLock lock(scanning_);
  if (!lastScanHolds()) last_ = scan();
  return last_;
}

bool LinuxApplicationRegistry::lastScanHolds() const {
  return last_.position != 0 && !changes_->changedSince(roots_, last_.position) &&
         std::ranges::all_of(last_.outsiders,
                             [](const Outsider& known) { return Outsider::at(known.path) == known; });
}

LinuxApplicationRegistry::Scan LinuxApplicationRegistry::scan() {
  const EventID position = changes_ ? changes_->currentEventID() : 0;
  if (!memory_) loadDatabase();
  ApplicationWalk walk = walkRoots();
  const std::size_t count = walk.applications.size();
  std::vector<Look> looks(count);
  queue_.apply(count, [&, memory = memory_](std::size_t index) {
    looks[index] = lookAt(walk.applications[index].path, *memory);
  });

  Scan result;
  RememberedApplications settled;
  std::vector<Application> applications;
  applications.reserve(count);
  bool isFinal = !walk.incomplete;
  for (std::size_t index = 0; index < count; ++index) {
    auto& [path, isLink] = walk.applications[index];
    const Look& look = looks[index];
    isFinal = isFinal && look.isSettled;
    result.isWhole = result.isWhole && !look.isTransient;
    if (look.isSettled || look.isTransient) settled.emplace_hint(settled.end(), path, look.application);
    if (isLink || look.isLink) result.outsiders.push_back({path, true, look.application.information});
    applications.push_back({std::move(path), look.application.flags});
  }
  for (std::string& path : walk.deadLinks) result.outsiders.push_back({std::move(path), false, {}});
  result.applications = std::make_shared<const std::vector<Application>>(std::move(applications));
  if (isFinal) result.position = position;
  if (walk.isTransient) {
    result.isWhole = false;
    if (last_.applications) result.applications = last_.applications;
  } else {
    remember(std::move(settled));
  }
  return result;
}

ApplicationWalk LinuxApplicationRegistry::walkRoots() {
  ApplicationWalk all;
  for (const std::string& root : roots_) {
    ApplicationWalk walk = walkApplications(root);
    if (walk.reachedLimit)
      log_.write("Too many or too deep folders in " + root + ": applications may be missing");
    all.incomplete = all.incomplete || walk.incomplete;
    all.isTransient = all.isTransient || walk.isTransient;
    std::ranges::move(walk.applications, std::back_inserter(all.applications));
    std::ranges::move(walk.deadLinks, std::back_inserter(all.deadLinks));
  }
  return all;
}

LinuxApplicationRegistry::Outsider LinuxApplicationRegistry::Outsider::at(const std::string& path) {
  return {path, platform::isDirectory(path), informationStatus(path).status};
}

LinuxApplicationRegistry::Look LinuxApplicationRegistry::lookAt(const std::string& application,
                                                                const RememberedApplications& memory) const {
  const InformationStatus before = informationStatus(application);
  const auto known = memory.find(application);
  const RememberedApplication earlier = known != memory.end() ? known->second : RememberedApplication();
  if (before.isTransient) return {earlier, false, before.isLink, true};
  if (before.isKnown && known != memory.end() && earlier.information == before.status)
    return {earlier, true, before.isLink, false};

  Look look{{before.status, 0}, before.isKnown, before.isLink, false};
  if (!before.exists()) return look;
  look.isSettled = !isRacy(before.status.changed, timeStampNow(), TimeStamps::Local);
  if (before.status.kind != EntryKind::File || before.status.size > largestForeignFile) return look;
  const FileReading file = files_.read(informationPath(application), largestForeignFile);
  if (file.isTransient) return {earlier, false, before.isLink, true};
  look.application.flags = file.bytes ? informationFlags(*file.bytes) : 0;
  look.isSettled = look.isSettled && file.bytes && informationStatus(application).status == before.status;
  return look;
}

void LinuxApplicationRegistry::remember(RememberedApplications settled) {
  if (settled == *memory_ && !databaseIsUnusable_) return;
  memory_ = std::make_shared<const RememberedApplications>(std::move(settled));
  databaseIsUnusable_ = false;
  if (!database_) return;
  const bool isWriting = unwritten_.with([memory = memory_](Unwritten& unwritten) {
    unwritten.memory = memory;
    return std::exchange(unwritten.isWriting, true);
  });
  if (!isWriting) background_.async(queue_, [this] { writeDatabase(); });
}

void LinuxApplicationRegistry::loadDatabase() {
  std::optional<RememberedApplications> loaded(std::in_place);
  if (database_ && files_.exists(*database_)) {
    const FileReading file = files_.read(*database_, largestApplicationDatabase);
    loaded = file.bytes ? decodeApplications(*file.bytes) : std::nullopt;
    if (!loaded) {
      log_.write("Ignoring the application database " + *database_ + ": " +
                 (file.bytes ? "damaged or of another version" : file.error));
    }
  }
  databaseIsUnusable_ = !loaded;
  memory_ =
      std::make_shared<const RememberedApplications>(std::move(loaded).value_or(RememberedApplications()));
}

void LinuxApplicationRegistry::writeDatabase() {
  const auto next = [this] {
    return unwritten_.with([](Unwritten& unwritten) {
      unwritten.isWriting = unwritten.memory != nullptr;
      return std::exchange(unwritten.memory, nullptr);
    });
  };
  while (const Memory memory = next()) {
    const auto bytes = encodeApplications(*memory);
    const auto error = bytes ? files_.writeAtomically(*database_, *bytes) : "too many applications";
    if (error) log_.write("Cannot remember the applications: " + *error);
  }
}

}  // namespace kel::platform
