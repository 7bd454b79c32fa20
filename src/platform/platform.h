#pragma once

#include <string>
#include <vector>

#include "platform/application_registry.h"
#include "platform/bundles.h"
#include "platform/clock.h"
#include "platform/conduit.h"
#include "platform/event_journal.h"
#include "platform/file_system.h"
#include "platform/guarded.h"
#include "platform/launch_events.h"
#include "platform/notification_seeds.h"
#include "platform/preferences.h"
#include "platform/process.h"
#include "platform/sandbox_query.h"
#include "platform/services_publication.h"
#include "platform/standard_directories.h"
#include "platform/system_facts.h"
#include "platform/system_log.h"
#include "platform/transactions.h"
#include "platform/work_queue.h"

namespace kel::platform {

/// Values that are computed once per process, at their first use.
struct ProcessConstants {
  Once<std::string> bootSessionID;
  Once<std::string> buildVersion;
  Once<std::vector<std::string>> serviceDirectoryPrecedence;
};

/// Every platform service. Made once, handed down by reference; outlives everything above it.
struct Platform {
  Clock& clock;
  ConcurrentQueue& concurrentQueue;
  FileSystem& files;
  StandardDirectories& directories;
  Bundles& bundles;
  SystemFacts& facts;
  SystemLog& log;
  Transactions& transactions;
  Conduit& conduit;
  SandboxQuery& sandbox;
  LaunchEvents& launchEvents;
  NotificationSeeds& seeds;
  ServicesPublication& publication;
  Preferences& preferences;
  ApplicationRegistry& applications;
  EventJournal& journal;
  Process& process;
  ProcessConstants& constants;
};

}  // namespace kel::platform
