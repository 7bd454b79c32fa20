#include "server/server.h"

#include <algorithm>
#include <mutex>
#include <utility>

#include "common/common.h"

namespace kel {

// How no change is lost between requests and rebuilds.
//
// A request finds on conduitQueue what is stale and queues a rebuild of that on the data-store queue.
// Rebuilds that queue up behind one another are folded: one stands for all requests that came before it
// began. It must have begun after them, for what it looked at before may have changed since; so the
// generation is raised when a rebuild begins. What began before a flush stands for no request that came after
// it. And it must look at all that they ask for; so a beginning rebuild takes the flags of every request
// queued so far, those of the works that it makes needless included.
//
// A flush clears the list on conduitQueue at once and the data store on its own queue later. What is made
// there in between was made from what is to be forgotten and does not become current; those who waited for it
// get it all the same. A list that is current is cleared on conduitQueue only, where requests are answered:
// none loses its data between the look whether there is any and the reply.

using platform::PropertyListArray;
using platform::PropertyListDictionaryBuilder;
using platform::PropertyListValue;

KELServer::KELServer(platform::Platform& platform)
    : platform_(platform),
      seedName_("user.uid." + std::to_string(platform.facts.realUserID()) + ".com.orvex.qvservices.seed"),
      protectedDatastore_(KELDataStore::initWithSystemServices(platform)),
      knownLoadedLocalizations_(std::make_shared<const Localizations>()) {
  notificationToken_ = platform_.seeds.registerName(seedName_);
  std::uint64_t seed = platform_.seeds.state(notificationToken_);
  while (seed == 0) {
    const std::uint64_t high = platform_.facts.random32();
    seed = high << 32 | platform_.facts.random32();
  }
  notificationSeed_ = seed;
}

KELServer::~KELServer() = default;

void KELServer::incrementServicesSeed() {
  while (++notificationSeed_ == 0) continue;
  seedQueue_.async([this, transaction = platform::Transaction(platform_.transactions)] {
    platform_.seeds.setState(notificationToken_, notificationSeed_);
    platform_.seeds.post(seedName_);
  });
}

void KELServer::sync(bool sync, std::function<void(KELDataStore&)> tellDataStore) {
  auto work = [this, tellDataStore = std::move(tellDataStore), sink = current_debug_sink(),
               transaction = platform::Transaction(platform_.transactions)] {
    run_with_debug_sink(sink, [&] {
      datastoreQueue_.assertCurrent();
      tellDataStore(*protectedDatastore_);
    });
  };
  if (sync) {
    datastoreQueue_.sync(work);
  } else {
    datastoreQueue_.async(std::move(work));
  }
}

void KELServer::schmutzItUpForKT(const PropertyListValue& publicDictionaries) {
  const auto localizations = knownLoadedLocalizations_.copy();
  PropertyListDictionaryBuilder publication;
  publication.set("KTVersion", 2);
  publication.set("KTPrincipalLocalizations",
                  PropertyListArray(localizations->begin(), localizations->end()));
  publication.set(platform::publishedListKey, publicDictionaries);
  const auto& queue = publicationQueue_.get(
      [] { return std::make_unique<platform::SerialQueue>("KEL KTServiceController"); });
  queue->async([this, publication = PropertyListValue(publication.build()),
                transaction = platform::Transaction(platform_.transactions)] {
    platform_.publication.publish(publication);
  });
}

platform::SharedBytes KELServer::setCurrentPublicDictionariesAllowingNotification(
    const std::optional<PropertyListValue>& publicDictionaries) {
  platform::SharedBytes newData;
  if (publicDictionaries) {
    platform::PropertyListWriting written = platform::writeBinaryPropertyList(*publicDictionaries);
    if (!written.bytes) {
      send_debug_line([&] { return "Error generating Services plist: " + written.error; });
      return nullptr;
    }
    newData = std::make_shared<const platform::Bytes>(std::move(*written.bytes));
  }
  {
    // Both queues change the list: publications come in the order of the changes.
    const std::lock_guard lock(changingList_);
    if (newData && queuedFlushes_ > 0) return newData;
    const platform::SharedBytes oldData = currentData();
    if (newData == oldData || (newData && oldData && *newData == *oldData)) return oldData;
    currentData_.set(newData);
    schmutzItUpForKT(publicDictionaries.value_or(PropertyListArray()));
  }
  incrementServicesSeed();
  return newData;
}

void KELServer::updateServicesCache(KELStaleCacheFlags flags, std::uint32_t ifGenerationIsCurrent,
                                    KELDataStore& inDataStore) {
  datastoreQueue_.assertCurrent();
  const std::uint32_t current = currentGenCount_;
  if (current > ifGenerationIsCurrent && current > genCountOfFlush_) {
    send_debug_line([&] {
      return "Coalescing Services update (gen counts were " + std::to_string(ifGenerationIsCurrent) + "/" +
             std::to_string(current);
    });
    return;
  }
  send_debug_line([] { return "Updating Services cache"; });
  // In this order: a request that reads the old count has left its flags, one that comes too late for its
  // flags to be taken reads the new count.
  ++currentGenCount_;
  inDataStore.updateServicesCache(flags | requestedFlags_.exchange(0));
  const auto localizations = knownLoadedLocalizations_.copy();
  inDataStore.fetchLocalizations(std::vector<std::string>(localizations->begin(), localizations->end()));
  lastMadeData_ = setCurrentPublicDictionariesAllowingNotification(inDataStore.currentPublicDictionaries());
  inDataStore.writeCaches();
  lookAgainAt(inDataStore.unsettledSources());
}

/// Has what could not be read for the moment read again, after seconds at first and then after minutes, until
/// nothing is left. Nobody asks for it: who waits for the seed must hear of it.
void KELServer::lookAgainAt(std::optional<KELStaleCacheFlags> unsettledSources) {
  static constexpr std::chrono::seconds latest{300};
  if (!unsettledSources) lookAgainAfter_ = soonestNextLook;
  lookAgainFor_ = unsettledSources.value_or(0);
  if (!unsettledSources || std::exchange(isToLookAgain_, true)) return;
  platform_.clock.after(datastoreQueue_, lookAgainAfter_, [this] {
    sync(false, [this](KELDataStore& dataStore) {
      datastoreQueue_.assertCurrent();
      isToLookAgain_ = false;
      lookAgainAfter_ = std::min(2 * lookAgainAfter_, latest);
      updateServicesCache(lookAgainFor_, currentGenCount_, dataStore);
    });
  });
}

void KELServer::reactToAppRegistrySeedingComplete() {
  conduitQueue_.assertCurrent();
  staleCacheFlags_ |= KELStaleAppRegistryPaths;
  incrementServicesSeed();
}

void KELServer::reactToAppRegistryDatabaseChange() {
  reactToChange(ARReactor_, KELStaleAppRegistryPaths, std::chrono::seconds(6));
}

void KELServer::reactToVigilChange() {
  reactToChange(VigilReactor_, KELStaleServiceDirectories, std::chrono::seconds(6));
}

void KELServer::reactToChange(KELEventReactor_t& withReactor, KELStaleCacheFlags dirtyingFlag,
                              std::chrono::duration<double> coalesceInterval) {
  conduitQueue_.assertCurrent();
  if (staleCacheFlags_ & dirtyingFlag) return;
  if (withReactor.reactionPending) return;
  withReactor.reactionPending = true;

  std::chrono::duration<double> delay{0};
  if (withReactor.lastReaction != 0) {
    const std::chrono::duration<double> elapsed{
        std::max(0.0, platform_.clock.wallClockSeconds() - withReactor.lastReaction)};
    delay = std::min(coalesceInterval, coalesceInterval - elapsed);
  }
  platform_.clock.after(conduitQueue_, std::chrono::duration_cast<std::chrono::nanoseconds>(delay),
                        [this, &withReactor, dirtyingFlag] {
                          conduitQueue_.assertCurrent();
                          staleCacheFlags_ |= dirtyingFlag;
                          incrementServicesSeed();
                          withReactor.reactionPending = false;
                          withReactor.lastReaction = platform_.clock.wallClockSeconds();
                        });
}

}  // namespace kel
