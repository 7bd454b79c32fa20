#include <utility>

#include "common/common.h"
#include "property_lists/property_list.h"
#include "server/server.h"

namespace kel {

using platform::ConduitMessage;
using platform::PropertyListDictionary;
using platform::PropertyListDictionaryBuilder;

namespace {

constexpr std::size_t mostKnownLocalizations = 256;

const PropertyListDictionary& dictionaryOf(const ConduitMessage* message) {
  static const PropertyListDictionary empty;
  const PropertyListDictionary* dictionary = message ? message->contents().asDictionary() : nullptr;
  return dictionary ? *dictionary : empty;
}

}  // namespace

void KELServer::performCommand(KELCommand command, std::shared_ptr<ConduitMessage> withMessage,
                               bool shouldDebug, bool /*remoteIsSandboxed: the gate has acted on it*/) {
  conduitQueue_.assertCurrent();
  const auto [sink, debugText] =
      shouldDebug ? CollectingSink::make() : std::pair<KELDebugSink, std::shared_ptr<CollectingSink>>();

  // Run once, on either queue. The list is read when the reply is made, so that a reply after queued work
  // carries what the work left.
  const bool withData = command != KELCommand::KELCommandFlush;
  const ReplyAction reply = [this, message = withMessage, debugText = debugText,
                             withData](const platform::SharedBytes& otherwise) {
    if (!message || !message->canReply()) return;
    PropertyListDictionaryBuilder contents;
    platform::SharedBytes data = withData ? currentData() : nullptr;
    if (!data) data = otherwise;
    if (data) contents.set(protocol::data, data);
    if (debugText) contents.set(protocol::debugOutput, debugText->text());
    message->reply(contents.build());
  };

  const auto perform = [&, message = withMessage.get()] {
    conduitQueue_.assertCurrent();
    switch (command) {
      case KELCommand::KELCommandFlush:
        performFlush(reply);
        break;
      case KELCommand::KELCommandGetServicesPlist:
      case KELCommand::KELCommandLocalizations:
        performGet(command, message, reply);
        break;
      case KELCommand::KELCommandGetAndUpdateServicesPlist:
        performGetAndUpdate(reply);
        break;
      default:
        platform_.log.write("KELServer::performCommand: unknown or invalid Conduit message: " +
                            (message ? platform::describeBriefly(message->contents()) : "(null)") + "\n");
        reply(nullptr);
    }
  };
  if (shouldDebug) {
    run_with_debug_sink(sink, perform);
  } else {
    perform();
  }
  if (withMessage) withMessage->discardContents();
}

void KELServer::performFlush(const ReplyAction& reply) {
  ++queuedFlushes_;
  sync(false, [this](KELDataStore& dataStore) {
    datastoreQueue_.assertCurrent();
    dataStore.flushCaches();
    lastMadeData_ = nullptr;
    genCountOfFlush_ = currentGenCount_;
    --queuedFlushes_;
  });
  knownLoadedLocalizations_.set(std::make_shared<const Localizations>());
  setCurrentPublicDictionariesAllowingNotification(std::nullopt);
  reply(nullptr);
}

void KELServer::performGet(KELCommand command, const ConduitMessage* message, const ReplyAction& reply) {
  KELStaleCacheFlags flags = std::exchange(staleCacheFlags_, 0);
  std::vector<std::string> localizations;
  bool newLocalization = false;
  if (command == KELCommand::KELCommandLocalizations) {
    localizations = requested_localizations(dictionaryOf(message));
    newLocalization = noteNewLocalization(localizations);
  }
  if (!currentData()) flags = loadFirstList(flags);
  if (newLocalization || flags != 0) {
    const std::uint32_t snapshot = requestRebuild(flags);
    sync(false, [this, flags, snapshot, newLocalization, localizations = std::move(localizations),
                 reply = newLocalization ? reply : ReplyAction()](KELDataStore& dataStore) {
      datastoreQueue_.assertCurrent();
      // A new localization must show in the list whatever was rebuilt meanwhile: the count read now always
      // passes.
      if (newLocalization) dataStore.fetchLocalizations(localizations);
      updateServicesCache(flags, newLocalization ? currentGenCount_.load() : snapshot, dataStore);
      if (newLocalization) reply(lastMadeData_);
    });
  }
  if (!newLocalization) reply(nullptr);
}

/// Adds the first of `localizations` to the known ones; true when it was not among them. There are so many
/// known ones at most: a client that goes on asking for new ones takes the place of others, which then count
/// as new again.
bool KELServer::noteNewLocalization(const std::vector<std::string>& localizations) {
  const auto known = knownLoadedLocalizations_.copy();
  if (localizations.empty() || known->contains(localizations.front())) return false;
  auto extended = std::make_shared<Localizations>(*known);
  if (extended->size() >= mostKnownLocalizations) extended->erase(extended->begin());
  extended->insert(localizations.front());
  knownLoadedLocalizations_.set(std::move(extended));
  return true;
}

/// Waits for the data store to give the list it remembers; returns `flags`, or everything when what it
/// remembers is from an earlier boot session.
KELStaleCacheFlags KELServer::loadFirstList(KELStaleCacheFlags flags) {
  sync(true, [this, &flags](KELDataStore& dataStore) {
    datastoreQueue_.assertCurrent();
    if (!dataStore.cacheIsFromThisBootSession()) flags = KELStaleEverything;
    lastMadeData_ = setCurrentPublicDictionariesAllowingNotification(dataStore.currentPublicDictionaries());
  });
  return flags;
}

/// Leaves `flags` for the next rebuild that begins; returns the generation that a rebuild for them must be
/// later than. In this order, see `updateServicesCache`.
std::uint32_t KELServer::requestRebuild(KELStaleCacheFlags flags) {
  requestedFlags_ |= flags;
  return currentGenCount_;
}

void KELServer::performGetAndUpdate(const ReplyAction& reply) {
  const std::uint32_t snapshot = requestRebuild(KELStaleEverything);
  sync(false, [this, snapshot, reply](KELDataStore& dataStore) {
    datastoreQueue_.assertCurrent();
    updateServicesCache(KELStaleEverything, snapshot, dataStore);
    reply(lastMadeData_);
  });
}

}  // namespace kel
