#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/application_registry.h"
#include "platform/file_system.h"
#include "platform/guarded.h"
#include "platform/linux/journal/change_log.h"
#include "platform/linux/queues/mutex.h"
#include "platform/linux/registry/application_database.h"
#include "platform/linux/registry/application_walk.h"
#include "platform/system_log.h"
#include "platform/work_queue.h"

namespace kel::platform {

/// The applications in the application directories: every directory whose name ends in ".app", there and in
/// plain subfolders, and every symbolic link of such a name that leads to a directory. Hidden folders,
/// bundles and other links are not looked into.
///
/// What was read is remembered, also on disk: a query lists the folders, looks at the status of every
/// information dictionary and reads those that changed. While the change log tells that nothing did, it does
/// not even list. One scan runs at a time. Any thread. Borrows everything it is given.
class LinuxApplicationRegistry final : public ApplicationRegistry {
 public:
  /// `roots` are the application directories, in order. Without a state directory nothing is remembered on
  /// disk; without `changes` every query scans.
  LinuxApplicationRegistry(FileSystem& files, SystemLog& log, ConcurrentQueue& queue,
                           std::vector<std::string> roots, const std::optional<std::string>& stateDirectory,
                           ChangeLog* changes);

  /// Waits for what runs in the background.
  ~LinuxApplicationRegistry() override;

  /// "/System/Applications/", "/Network/Applications/", "/Applications/" and "Applications/" in `home`.
  static std::vector<std::string> applicationDirectories(const std::string& home);

  /// In the order of the roots, then of the paths. Information dictionaries are read in parallel; one that
  /// cannot be read sets no flag; for one that cannot be read for the moment the flag stands that it had. A
  /// walk that such an error cuts short takes the place of none.
  RegisteredApplications applications(std::uint32_t mask, std::uint32_t value) override;

  /// Scans in the background, then calls `done`, once, on a thread of the pool. A query that comes meanwhile
  /// waits, and scans again only when something may have changed since.
  void seed(std::function<void()> done);

 private:
  struct Application {
    std::string path;
    std::uint32_t flags = 0;
  };
  using Applications = std::shared_ptr<const std::vector<Application>>;
  using Memory = std::shared_ptr<const RememberedApplications>;

  /// An application that may change without any change below the roots, and what it was like.
  struct Outsider {
    std::string path;
    bool isDirectory = false;
    EntryStatus information;

    static Outsider at(const std::string& path);
    bool operator==(const Outsider&) const = default;
  };

  /// What one look at an application tells.
  struct Look {
    RememberedApplication application;
    bool isSettled = false;    ///< any later change shows in the status
    bool isLink = false;       ///< the information dictionary lies somewhere else
    bool isTransient = false;  ///< it could not be read for the moment
  };

  /// What the last scan found, and what it takes to answer from that.
  struct Scan {
    Applications applications;
    EventID position = 0;  ///< of the change log, before the scan; 0 when the scan does not answer for later
    std::vector<Outsider> outsiders;
    bool isWhole = true;  ///< nothing was left out, or as it was, because of an error that may pass
  };

  struct Unwritten {
    Memory memory;           ///< null when there is none
    bool isWriting = false;  ///< some task looks for it
  };

  Scan current();
  bool lastScanHolds() const KEL_RUNS_ON(scanning_);
  Scan scan() KEL_RUNS_ON(scanning_);
  ApplicationWalk walkRoots();
  Look lookAt(const std::string& application, const RememberedApplications& memory) const;
  void remember(RememberedApplications settled) KEL_RUNS_ON(scanning_);
  void loadDatabase() KEL_RUNS_ON(scanning_);
  void writeDatabase();

  FileSystem& files_;
  SystemLog& log_;
  ConcurrentQueue& queue_;
  const std::vector<std::string> roots_;
  const std::optional<std::string> database_;
  ChangeLog* const changes_;

  Mutex scanning_;  // held over a whole scan
  Scan last_ KEL_ON(scanning_);
  Memory memory_ KEL_ON(scanning_);  // null before the database was read
  bool databaseIsUnusable_ KEL_ON(scanning_) = false;

  Guarded<Unwritten> unwritten_;
  Group background_;
};

}  // namespace kel::platform
