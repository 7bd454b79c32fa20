#include "server/server.h"

#include <algorithm>
#include <mutex>
#include <utility>

#include "common/common.h"

namespace kel {

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
  std::uint64_t seed = 0;
  while (seed == 0) seed = ++notificationSeed_;
  // The other queue may raise it meanwhile: whoever stores last stores the newest.
  for (std::uint64_t stored = 0; stored != seed; seed = notificationSeed_) {
    stored = seed;
    platform_.seeds.setState(notificationToken_, stored);
  }
  platform_.seeds.post(seedName_);
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
  publication.set("KTVendedServices", publicDictionaries);
  const auto& queue = publicationQueue_.get(
      [] { return std::make_unique<platform::SerialQueue>("KEL KTServiceController"); });
  queue->async([this, publication = PropertyListValue(publication.build()),
                transaction = platform::Transaction(platform_.transactions)] {
    platform_.publication.publish(publication);
  });
}

void KELServer::setCurrentPublicDictionariesAllowingNotification(
    const std::optional<PropertyListValue>& publicDictionaries) {
  platform::SharedBytes newData;
  if (publicDictionaries) {
    platform::PropertyListWriting written = platform::writeBinaryPropertyList(*publicDictionaries);
    if (!written.bytes) {
      send_debug_line([&] { return "Error generating Services plist: " + written.error; });
      return;
    }
    newData = std::make_shared<const platform::Bytes>(std::move(*written.bytes));
  }
  {
    // Both queues change the list: publications come in the order of the changes.
    const std::lock_guard lock(changingList_);
    const platform::SharedBytes oldData = currentData();
    if (newData == oldData || (newData && oldData && *newData == *oldData)) return;
    currentData_.set(newData);
    schmutzItUpForKT(publicDictionaries.value_or(PropertyListArray()));
  }
  incrementServicesSeed();
}

void KELServer::updateServicesCache(KELStaleCacheFlags flags, std::uint32_t ifGenerationIsCurrent,
                                    KELDataStore& inDataStore) {
  datastoreQueue_.assertCurrent();
  const std::uint32_t current = currentGenCount_;
  if (current > ifGenerationIsCurrent) {
    send_debug_line([&] {
      return "Coalescing Services update (gen counts were " + std::to_string(ifGenerationIsCurrent) + "/" +
             std::to_string(current);
    });
    return;
  }
  send_debug_line([] { return "Updating Services cache"; });
  inDataStore.updateServicesCache(flags);
  const auto localizations = knownLoadedLocalizations_.copy();
  inDataStore.fetchLocalizations(std::vector<std::string>(localizations->begin(), localizations->end()));
  setCurrentPublicDictionariesAllowingNotification(inDataStore.currentPublicDictionaries());
  inDataStore.writeCaches();
  ++currentGenCount_;
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
