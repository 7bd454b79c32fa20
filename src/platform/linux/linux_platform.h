#pragma once

#include "platform/linux/conduit/linux_conduit.h"
#include "platform/linux/files/linux_bundles.h"
#include "platform/linux/files/linux_file_system.h"
#include "platform/linux/files/linux_preferences.h"
#include "platform/linux/files/linux_services_publication.h"
#include "platform/linux/files/linux_standard_directories.h"
#include "platform/linux/files/runtime_directory.h"
#include "platform/linux/journal/linux_event_journal.h"
#include "platform/linux/notifications/linux_notification_seeds.h"
#include "platform/linux/process/linux_process.h"
#include "platform/linux/process/linux_sandbox_query.h"
#include "platform/linux/process/linux_system_facts.h"
#include "platform/linux/process/linux_system_log.h"
#include "platform/linux/process/linux_transactions.h"
#include "platform/linux/queues/linux_clock.h"
#include "platform/linux/registry/linux_application_registry.h"
#include "platform/linux/registry/linux_launch_events.h"
#include "platform/platform.h"

namespace kel::platform {

/// Owns one of every platform service of this machine. Made once, at the start of `main`, when no other
/// thread runs; outlives everything that uses it.
///
/// Without a runtime directory the program still starts: the reason is logged, endpoints cannot be bound or
/// reached, and notification states are lost.
class LinuxPlatform {
 public:
  LinuxPlatform();
  LinuxPlatform(const LinuxPlatform&) = delete;
  LinuxPlatform& operator=(const LinuxPlatform&) = delete;

  Platform& platform() { return platform_; }

 private:
  // In the order of need: each borrows only what stands before it.
  LinuxProcess process_;
  LinuxClock clock_;
  LinuxSystemLog log_;
  LinuxSystemFacts facts_;
  const RuntimeDirectory runtimeDirectory_;
  ConcurrentQueue concurrentQueue_;
  LinuxFileSystem files_;
  LinuxStandardDirectories directories_;
  LinuxBundles bundles_;
  LinuxTransactions transactions_;
  LinuxConduit conduit_;
  LinuxSandboxQuery sandbox_;
  LinuxNotificationSeeds seeds_;
  LinuxServicesPublication publication_;
  LinuxPreferences preferences_;
  LinuxEventJournal journal_;
  LinuxApplicationRegistry applications_;
  LinuxLaunchEvents launchEvents_;
  ProcessConstants constants_;
  Platform platform_;
};

}  // namespace kel::platform
