#pragma once

#include "platform/platform.h"
#include "support/in_memory_bundles.h"
#include "support/in_memory_conduit.h"
#include "support/in_memory_directories.h"
#include "support/in_memory_files.h"
#include "support/in_memory_services.h"
#include "support/manual_clock.h"

namespace kel::test {

/// A whole platform without a system behind it; only the work queues are the real ones. A fresh one starts
/// afresh, once-computed values included.
struct InMemoryPlatform {
  ManualClock clock;
  platform::ConcurrentQueue concurrentQueue;
  InMemoryFileSystem files;
  InMemoryDirectories directories;
  InMemoryBundles bundles{files};
  InMemoryFacts facts;
  RecordingLog log;
  CountingTransactions transactions;
  InMemoryConduit conduit;
  InMemorySandbox sandbox;
  InMemoryLaunchEvents launchEvents;
  InMemorySeeds seeds;
  InMemoryPublication publication;
  InMemoryRegistry registry;
  InMemoryJournal journal;
  InMemoryProcess process;
  platform::ProcessConstants constants;

  platform::Platform platform{.clock = clock,
                              .concurrentQueue = concurrentQueue,
                              .files = files,
                              .directories = directories,
                              .bundles = bundles,
                              .facts = facts,
                              .log = log,
                              .transactions = transactions,
                              .conduit = conduit,
                              .sandbox = sandbox,
                              .launchEvents = launchEvents,
                              .seeds = seeds,
                              .publication = publication,
                              .preferences = publication,
                              .applications = registry,
                              .journal = journal,
                              .process = process,
                              .constants = constants};
};

}  // namespace kel::test
