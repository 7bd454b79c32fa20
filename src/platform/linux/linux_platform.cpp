#include "platform/linux/linux_platform.h"

#include <algorithm>
#include <charconv>
#include <fcntl.h>
#include <utility>

#include "platform/linux/files/files.h"

namespace kel::platform {

namespace {

/// Where notification records are kept; without a runtime directory a place that cannot be made.
std::string recordDirectory(const RuntimeDirectory& runtime) {
  return runtime.path ? joinPath(*runtime.path, "beacond") : "/dev/null/beacond";
}

JournalOptions journalOptions(const std::optional<std::string>& stateDirectory, std::string home) {
  JournalOptions options;
  options.limits.home = std::move(home);
  // Half of what the user may watch is left to the user's other programs.
  const auto most = readSmallFile(AT_FDCWD, "/proc/sys/fs/inotify/max_user_watches");
  std::size_t mostOfUser = 0;
  if (most && std::from_chars(most->data(), most->data() + most->size(), mostOfUser).ec == std::errc()) {
    options.limits.mostWatches = std::min(options.limits.mostWatches, mostOfUser / 2);
  }
  if (stateDirectory) options.directory = joinPath(*stateDirectory, "kel");
  return options;
}

}  // namespace

LinuxPlatform::LinuxPlatform()
    : runtimeDirectory_(resolveRuntimeDirectory()),
      files_(log_),
      directories_(facts_, runtimeDirectory_.path),
      bundles_(files_, log_),
      transactions_(facts_.environmentVariable("NOTIFY_SOCKET")),
      conduit_(log_, clock_,
               {.trackActivity = [this] { transactions_.trackActivity(); },
                .runtimeDirectory = [this] { return runtimeDirectory_; }}),
      seeds_(recordDirectory(runtimeDirectory_), log_),
      publication_(files_, log_, directories_.stateDirectory()),
      preferences_(files_, directories_.stateDirectory(), directories_.configurationDirectory()),
      journal_(journalOptions(directories_.stateDirectory(), directories_.homeDirectory()), files_, log_,
               concurrentQueue_),
      applications_(files_, log_, concurrentQueue_,
                    LinuxApplicationRegistry::applicationDirectories(directories_.homeDirectory()),
                    directories_.stateDirectory(), &journal_),
      launchEvents_(seeds_, log_, journal_, applications_),
      platform_{clock_,       concurrentQueue_, files_,        directories_, bundles_,      facts_,
                log_,         transactions_,    conduit_,      sandbox_,     launchEvents_, seeds_,
                publication_, preferences_,     applications_, journal_,     process_,      constants_} {
  if (!runtimeDirectory_.path) log_.write("No runtime directory: " + runtimeDirectory_.error);
}

void LinuxPlatform::watchServiceDirectories(const std::vector<std::string>& directories) {
  std::vector<WatchedRoot> roots;
  for (const std::string& directory : directories) roots.push_back({directory, false});
  for (std::string& directory :
       LinuxApplicationRegistry::applicationDirectories(directories_.homeDirectory())) {
    roots.push_back({std::move(directory), true});
  }
  journal_.setRoots(std::move(roots));
}

}  // namespace kel::platform
