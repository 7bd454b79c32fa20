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
  options.applicationDirectories = LinuxApplicationRegistry::applicationDirectories(home);
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
      platform_{.clock = clock_,
                .concurrentQueue = concurrentQueue_,
                .files = files_,
                .directories = directories_,
                .bundles = bundles_,
                .facts = facts_,
                .log = log_,
                .transactions = transactions_,
                .conduit = conduit_,
                .sandbox = sandbox_,
                .launchEvents = launchEvents_,
                .seeds = seeds_,
                .publication = publication_,
                .preferences = preferences_,
                .applications = applications_,
                .journal = journal_,
                .process = process_,
                .constants = constants_} {
  if (!runtimeDirectory_.path) log_.write("No runtime directory: " + runtimeDirectory_.error);
}

}  // namespace kel::platform
