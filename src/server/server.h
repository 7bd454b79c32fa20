#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "common/queue_depths.h"
#include "datastore/data_store.h"
#include "platform/guarded.h"
#include "platform/platform.h"
#include "protocol/request_protocol.h"

namespace kel {

/// Folds a burst of changes into one reaction.
struct KELEventReactor_t {
  bool reactionPending = false;
  double lastReaction = 0;  ///< wall-clock seconds; 0 means never
};

/// The server's state: the data store, the two queues that order all work, the published list and the seed
/// that tells applications to ask again.
///
/// Affinity: requests and reactions on `conduitQueue`, everything that touches the data store on the
/// data-store queue; each operation says which. `conduitQueue` may wait for the data-store queue, never the
/// other way round. Borrows the platform. Destroy it from another thread, when nothing hands it work any
/// more: queued work runs first.
class KELServer {
 public:
  using Localizations = std::set<std::string>;

  explicit KELServer(platform::Platform& platform);
  ~KELServer();
  KELServer(const KELServer&) = delete;
  KELServer& operator=(const KELServer&) = delete;

  /// Every IPC event, launch event and reactor timer runs here.
  platform::SerialQueue& conduitQueue() KEL_RETURNS_CAPABILITY(conduitQueue_) { return conduitQueue_; }

  /// Raises the seed; `seedQueue` stores and posts it. Any thread.
  void incrementServicesSeed();

  /// Seeds reach the platform here, so that none that is older follows a newer one.
  platform::SerialQueue& seedQueue() { return seedQueue_; }

  /// Runs `tellDataStore` on the data-store queue under the caller's debug sink; waits for it when `sync` is
  /// true.
  void sync(bool sync, std::function<void(KELDataStore&)> tellDataStore);

  /// Makes `publicDictionaries` (an array, or none) the current list; publishes it and raises the seed if its
  /// bytes differ from those of the list before. A list, on the data-store queue; none, on `conduitQueue`. A
  /// list made before a flush that has been asked for is not made current. Returns the list's bytes, null for
  /// none and for one that cannot be written.
  platform::SharedBytes setCurrentPublicDictionariesAllowingNotification(
      const std::optional<platform::PropertyListValue>& publicDictionaries);

  /// Rebuilds the list unless a rebuild has begun since `ifGenerationIsCurrent` was read, and since the last
  /// flush; looks at what
  /// `flags` say and at what every request queued so far asks for. Data-store queue.
  void updateServicesCache(KELStaleCacheFlags flags, std::uint32_t ifGenerationIsCurrent,
                           KELDataStore& inDataStore);

  // Reactions to changes: they mark what is stale and raise the seed; the next request rebuilds.
  // `conduitQueue`.
  void reactToAppRegistrySeedingComplete() KEL_RUNS_ON(conduitQueue_);
  void reactToAppRegistryDatabaseChange() KEL_RUNS_ON(conduitQueue_);
  void reactToVigilChange() KEL_RUNS_ON(conduitQueue_);

  /// Carries out a request that has passed the gate and answers it once, now or when its work is done.
  /// `conduitQueue`. The message may be null: then nothing is answered.
  void performCommand(KELCommand command, std::shared_ptr<platform::ConduitMessage> withMessage,
                      bool shouldDebug, bool remoteIsSandboxed) KEL_RUNS_ON(conduitQueue_);

  /// The published list as a binary property list; null before the first load and after a flush. Any thread.
  platform::SharedBytes currentData() const { return currentData_.copy(); }

  /// The localizations asked for since the start or the last flush. Any thread.
  Localizations knownLoadedLocalizations() const { return *knownLoadedLocalizations_.copy(); }

 private:
  static constexpr std::chrono::seconds soonestNextLook{5};

  /// Sends the reply with the current list, else with `otherwise`, which may be null.
  using ReplyAction = std::function<void(const platform::SharedBytes& otherwise)>;

  void schmutzItUpForKT(const platform::PropertyListValue& publicDictionaries);
  void reactToChange(KELEventReactor_t& withReactor, KELStaleCacheFlags dirtyingFlag,
                     std::chrono::duration<double> coalesceInterval) KEL_RUNS_ON(conduitQueue_);
  void performFlush(const ReplyAction& reply) KEL_RUNS_ON(conduitQueue_);
  void performGet(KELCommand command, const platform::ConduitMessage* message, const ReplyAction& reply)
      KEL_RUNS_ON(conduitQueue_);
  void performGetAndUpdate(const ReplyAction& reply) KEL_RUNS_ON(conduitQueue_);
  bool noteNewLocalization(const std::vector<std::string>& localizations) KEL_RUNS_ON(conduitQueue_);
  KELStaleCacheFlags loadFirstList(KELStaleCacheFlags flags) KEL_RUNS_ON(conduitQueue_);
  std::uint32_t requestRebuild(KELStaleCacheFlags flags) KEL_RUNS_ON(conduitQueue_);
  void lookAgainAt(std::optional<KELStaleCacheFlags> unsettledSources) KEL_RUNS_ON(datastoreQueue_);

  // Fixed after construction.
  platform::Platform& platform_;
  const std::string seedName_;
  platform::NotificationSeeds::Token notificationToken_ = 0;

  const std::unique_ptr<KELDataStore> protectedDatastore_ KEL_TARGET_ON(datastoreQueue_);
  std::atomic<std::uint32_t> currentGenCount_ = 0;      // raised only on datastoreQueue_
  std::atomic<KELStaleCacheFlags> requestedFlags_ = 0;  // of the requests since a rebuild last began
  std::atomic<std::uint32_t> queuedFlushes_ = 0;        // asked for, but not yet carried out
  platform::SharedBytes lastMadeData_ KEL_ON(datastoreQueue_);
  std::uint32_t genCountOfFlush_ KEL_ON(datastoreQueue_) = 0;  // when the last flush was carried out
  std::atomic<std::uint64_t> notificationSeed_ = 0;
  std::mutex changingList_;  // held while the list is compared, set and handed to publication
  platform::Guarded<platform::SharedBytes> currentData_;
  platform::Guarded<std::shared_ptr<const Localizations>> knownLoadedLocalizations_;
  platform::Once<std::unique_ptr<platform::SerialQueue>> publicationQueue_;

  KELEventReactor_t ARReactor_ KEL_ON(conduitQueue_);
  KELEventReactor_t VigilReactor_ KEL_ON(conduitQueue_);
  KELStaleCacheFlags staleCacheFlags_ KEL_ON(conduitQueue_) = 0;
  KELStaleCacheFlags lookAgainFor_ KEL_ON(datastoreQueue_) = 0;
  bool isToLookAgain_ KEL_ON(datastoreQueue_) = false;
  std::chrono::seconds lookAgainAfter_ KEL_ON(datastoreQueue_) = soonestNextLook;

  // Last, so that work still queued at destruction finds everything above: the conduit queue ends first.
  platform::SerialQueue seedQueue_{"KEL Seed"};
  platform::SerialQueue datastoreQueue_{"KEL Datastore", queue_depths::datastore};
  platform::SerialQueue conduitQueue_{"KEL Conduit Server", queue_depths::conduit};
};

}  // namespace kel
