#include "server/server.h"

#include <gmock/gmock.h>
#include <limits>

#include "server/run_as_server.h"
#include "support/in_memory_platform.h"
#include "support/property_lists.h"

namespace kel {
namespace {

using namespace std::chrono_literals;
using platform::ConduitError;
using platform::ConduitMessage;
using platform::ConduitReply;
using platform::PropertyListArray;
using platform::PropertyListDictionary;
using platform::PropertyListValue;
using test::dictionary;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::MatchesRegex;
using testing::Not;
using testing::SizeIs;

constexpr const char* seedName = "user.uid.501.com.orvex.qvservices.seed";
constexpr const char* cachePath = "/home/u/.cache/com.orvex.qvservicescache.plist";
constexpr const char* bundle = "/home/u/Library/Services/one.service";

PropertyListValue request(const char* command) { return dictionary({{"command", command}}); }
const PropertyListValue get = request("get_services_plist");
const PropertyListValue update = request("get_and_update_services_plist");
PropertyListValue debugRequest(const char* command) {
  return dictionary({{"command", command}, {"debug", true}});
}
PropertyListValue localizations(PropertyListArray names) {
  return dictionary({{"localizations", std::move(names)}});
}

PropertyListDictionary information(const std::string& title) {
  const PropertyListDictionary service = dictionary({{"QVMenuItem", dictionary({{"default", title}})}});
  return dictionary({{"KTBundleIdentifier", "org.a.one"}, {"QVServices", PropertyListArray{service}}});
}

class ServerTest : public testing::Test {
 protected:
  using Answer = std::shared_ptr<test::InMemoryMessage::Answer>;

  ServerTest() {
    system.clock.setWallClock(1'000'000);
    addBundle(system.files, bundle, information("One"));
  }

  /// Waits until both queues have run what they hold, and what that queued.
  void drain() {
    for (int round = 0; round < 3; ++round) {
      server.conduitQueue().sync([] {});
      server.sync(true, [](KELDataStore&) {});
    }
  }

  /// Hands a request over as a connection would, without waiting for its answer.
  static Answer sendTo(KELServer& server, const PropertyListValue& contents, bool wantsReply = true) {
    auto answer = std::make_shared<test::InMemoryMessage::Answer>();
    const PropertyListDictionary& entries = *contents.asDictionary();
    server.conduitQueue().sync([&] {
      server.conduitQueue().assertCurrent();
      server.performCommand(classify_request(entries),
                            std::make_shared<test::InMemoryMessage>(contents, wantsReply, answer),
                            wants_debug(entries), false);
    });
    return answer;
  }
  Answer send(const PropertyListValue& contents) { return sendTo(server, contents); }

  /// Carries out a request and all that it queues.
  void perform(const PropertyListValue& contents) {
    send(contents)->wait();
    drain();
  }

  static PropertyListDictionary replyOf(const Answer& answer) {
    return *std::get<PropertyListValue>(answer->wait()).asDictionary();
  }
  static std::string debugOutput(const Answer& answer) {
    return *replyOf(answer).find("debug_output")->asString();
  }
  static PropertyListValue listOf(const Answer& answer) {
    return *platform::readPropertyList(**replyOf(answer).find("data")->asData()).value;
  }
  static std::vector<std::string> titles(const Answer& answer) { return test::defaultTitles(listOf(answer)); }
  std::vector<std::string> titles() { return titles(send(get)); }

  void react(void (KELServer::*reaction)()) {
    server.conduitQueue().sync([&] { (server.*reaction)(); });
    drain();
  }

  /// Keeps the data-store queue busy until `release` is called.
  void blockDataStore() {
    blocked = std::make_shared<platform::Semaphore>();
    server.sync(false, [gate = blocked](KELDataStore&) { gate->wait(60s); });
  }
  void release() { blocked->signal(); }

  std::uint64_t seed() { return system.seeds.stateOf(seedName); }
  std::size_t posts() { return system.seeds.postsOf(seedName); }
  void setLists(const std::optional<PropertyListValue>& lists) {
    server.setCurrentPublicDictionariesAllowingNotification(lists);
  }

  test::InMemoryPlatform system;
  std::shared_ptr<platform::Semaphore> blocked;
  KELServer server{system.platform};
};

TEST_F(ServerTest, TheFirstRequestLoadsTheListAndQueuesAFullRebuildWhenTheCacheIsNotOfThisBoot) {
  EXPECT_THAT(titles(), IsEmpty());
  drain();
  EXPECT_THAT(titles(), ElementsAre("One"));
  EXPECT_EQ(system.registry.queries, 1U);
}

TEST_F(ServerTest, ARestartAnswersFromACacheOfThisBootAndRebuildsNothing) {
  perform(update);
  server.sync(true, [](KELDataStore& store) { store.writeCaches(); });
  const std::size_t queries = system.registry.queries;
  {
    KELServer restarted(system.platform);
    EXPECT_THAT(titles(sendTo(restarted, get)), ElementsAre("One"));
  }
  EXPECT_EQ(system.registry.queries, queries);
}

TEST_F(ServerTest, TheListAtHandIsAnsweredAtOnceAndWhenStaleTheNewOneNextTime) {
  send(update)->wait();
  blockDataStore();
  EXPECT_THAT(titles(send(localizations({}))), ElementsAre("One"));
  release();
  addBundle(system.files, bundle, information("Changed"));
  system.journal.record(std::string(bundle) + "/Info.plist");
  react(&KELServer::reactToVigilChange);
  const std::uint64_t seedBefore = seed();
  blockDataStore();
  EXPECT_THAT(titles(), ElementsAre("One"));
  release();
  drain();
  EXPECT_GT(seed(), seedBefore) << "nobody was told to ask again";
  EXPECT_THAT(titles(), ElementsAre("Changed"));
}

TEST_F(ServerTest, UpdatesQueuedAgainstOneGenerationRebuildOnceAndAllWaitForIt) {
  blockDataStore();
  std::vector<Answer> answers;
  for (int i = 0; i < 3; ++i) answers.push_back(send(debugRequest("get_and_update_services_plist")));
  EXPECT_FALSE(answers[0]->isThere());
  release();
  EXPECT_THAT(debugOutput(answers[0]), HasSubstr("Updating Services cache\nLoading cache from "));
  EXPECT_EQ(debugOutput(answers[1]), "Coalescing Services update (gen counts were 0/1");
  EXPECT_EQ(debugOutput(answers[2]), "Coalescing Services update (gen counts were 0/1");
  EXPECT_THAT(titles(answers[2]), ElementsAre("One"));
}

TEST_F(ServerTest, ANewLocalizationWaitsForARebuildThatAlwaysRuns) {
  addMenuStrings(system.files, bundle, "de", dictionary({{"One", "Eins"}}));
  perform(update);
  blockDataStore();
  const Answer first = send(localizations({"de", "fr"}));
  const Answer debugged = send(debugRequest("get_and_update_services_plist"));
  EXPECT_FALSE(first->isThere());
  release();
  const PropertyListValue list = listOf(first);
  EXPECT_EQ(*list.asArray()->front().asDictionary()->find("QVMenuItem")->asDictionary()->find("de"), "Eins");
  EXPECT_THAT(debugOutput(debugged), HasSubstr("Coalescing")) << "the rebuild for de did not count";
  EXPECT_THAT(server.knownLoadedLocalizations(), ElementsAre("de"));
  blockDataStore();
  EXPECT_TRUE(send(localizations({"de", "xx"}))->isThere());
  release();
}

TEST_F(ServerTest, AFlushAnswersWithoutDataBeforeTheFileIsGoneAndTheNextGetLoadsAgain) {
  send(localizations({"de"}))->wait();
  server.sync(true, [](KELDataStore& store) { store.writeCaches(); });
  drain();
  blockDataStore();
  EXPECT_EQ(replyOf(send(request("flush"))), PropertyListDictionary());
  EXPECT_THAT(server.knownLoadedLocalizations(), IsEmpty());
  release();
  drain();
  EXPECT_FALSE(system.files.isFile(cachePath));
  EXPECT_THAT(titles(), IsEmpty());
  drain();
  EXPECT_THAT(titles(), ElementsAre("One"));
}

TEST_F(ServerTest, AFlushOutlivesARebuildThatWasUnderWay) {
  perform(get);
  blockDataStore();
  const Answer rebuilt = send(update);
  send(request("flush"));
  release();
  rebuilt->wait();
  drain();
  EXPECT_EQ(server.currentData(), nullptr);
}

TEST_F(ServerTest, ClientsThatAskForEverNewLocalizationsDisplaceOthersAndShutNobodyOut) {
  for (int i = 0; i < 300; ++i) send(localizations({"x" + std::to_string(i)}))->wait();
  send(localizations({"de"}))->wait();
  EXPECT_THAT(server.knownLoadedLocalizations(), testing::AllOf(SizeIs(256), testing::Contains("de")));
  send(localizations({std::string(129, 'n'), "fr"}))->wait();
  EXPECT_THAT(server.knownLoadedLocalizations(), Not(testing::Contains("fr"))) << "the first one decides";
}

TEST_F(ServerTest, OddRequestsAreCarriedOutOrAnsweredAllTheSame) {
  sendTo(server, update, false);
  drain();
  EXPECT_NE(server.currentData(), nullptr);
  EXPECT_THAT(titles(send(dictionary({{"command", "nonsense"}}))), ElementsAre("One"));
  EXPECT_THAT(system.log.take(),
              ElementsAre(HasSubstr("KELServer::performCommand: unknown or invalid Conduit message: {")));
  server.conduitQueue().sync([this] {
    server.conduitQueue().assertCurrent();
    server.performCommand(KELCommand::KELCommandFlush, nullptr, true, false);
  });
  EXPECT_EQ(current_debug_sink(), nullptr);
}

TEST_F(ServerTest, AnEqualListIsNeitherPublishedNorAnnounced) {
  const PropertyListValue list = PropertyListArray{dictionary({{"a", 1}})};
  setLists(std::nullopt);
  EXPECT_EQ(posts(), 0U) << "none over none";
  setLists(list);
  setLists(PropertyListArray{dictionary({{"a", 1}})});
  EXPECT_EQ(posts(), 1U);
  PropertyListValue tooDeep = 0;
  for (int level = 0; level < 600; ++level) tooDeep = PropertyListArray{tooDeep};
  setLists(tooDeep);
  EXPECT_EQ(posts(), 1U) << "a list that cannot be written took the place of one that can";
  setLists(std::nullopt);
  EXPECT_EQ(posts(), 2U);
  EXPECT_EQ(server.currentData(), nullptr);
}

TEST_F(ServerTest, PublicationsComeInTheOrderOfTheChangesWithTheKnownLocalizations) {
  send(localizations({"de"}))->wait();
  setLists(PropertyListArray{dictionary({{"last", true}})});
  system.platform.transactions.open();
  while (system.transactions.openCount > 1) drain();
  system.platform.transactions.close();
  const std::vector<PropertyListValue> publications = system.publication.publications();
  ASSERT_THAT(publications, SizeIs(3));
  EXPECT_EQ(*publications[0].asDictionary()->find("KTVendedServices"), PropertyListArray{});
  EXPECT_EQ(
      publications[2],
      PropertyListValue(dictionary({{"KTVersion", 2},
                                    {"KTPrincipalLocalizations", PropertyListArray{"de"}},
                                    {"KTVendedServices", PropertyListArray{dictionary({{"last", true}})}}})));
}

TEST(ServerSeedTest, IsKeptDrawnAtRandomAndNeverZero) {
  test::InMemoryPlatform kept;
  kept.seeds.setStateOf(seedName, std::numeric_limits<std::uint64_t>::max());
  KELServer(kept.platform).incrementServicesSeed();
  EXPECT_EQ(kept.seeds.stateOf(seedName), 1U);

  test::InMemoryPlatform fresh;
  fresh.facts.randomNumbers = {0, 0, 0xabcd, 0x1234};
  KELServer server(fresh.platform);
  EXPECT_EQ(fresh.seeds.stateOf(seedName), 0U) << "the drawn seed is not stored before the first change";
  server.incrementServicesSeed();
  EXPECT_EQ(fresh.seeds.stateOf(seedName), 0xabcd00001235U);
  EXPECT_EQ(fresh.seeds.postsOf(seedName), 1U);
}

class ReactorTest : public ServerTest {
 protected:
  /// What a request does with the flags: it clears them.
  void clearFlags() {
    perform(get);
    before = posts();
  }
  std::size_t newPosts() { return posts() - before; }
  void change() { react(&KELServer::reactToAppRegistryDatabaseChange); }
  void advance(std::chrono::nanoseconds duration) {
    system.clock.advance(duration);
    drain();
  }

  std::size_t before = 0;
};

TEST_F(ReactorTest, ABurstAfterQuietGivesOneReactionAtOnce) {
  perform(update);
  clearFlags();
  for (int i = 0; i < 10; ++i)
    server.conduitQueue().async([this] {
      server.conduitQueue().assertCurrent();
      server.reactToAppRegistryDatabaseChange();
    });
  drain();
  EXPECT_EQ(newPosts(), 1U);
  change();
  advance(1h);
  EXPECT_EQ(newPosts(), 1U) << "the flag was set, clients already know";
}

TEST_F(ReactorTest, AChangeSoonAfterAReactionIsAnsweredSixSecondsAfterItAndAClockSetBackCountsAsNoTime) {
  change();
  clearFlags();
  advance(1s);
  change();
  change();
  advance(5s - 1ms);
  EXPECT_EQ(newPosts(), 0U);
  advance(1ms);
  EXPECT_EQ(newPosts(), 1U);

  clearFlags();
  system.clock.setWallClock(10);
  change();
  advance(6s - 1ms);
  EXPECT_EQ(newPosts(), 0U);
  advance(1ms);
  EXPECT_EQ(newPosts(), 1U);
  clearFlags();
  advance(1h);
  change();
  EXPECT_EQ(newPosts(), 1U) << "delayed after a long quiet";
}

TEST_F(ReactorTest, SeedingCompleteIsToldEveryTimeAndEachReactorMarksItsOwnFlag) {
  perform(update);
  clearFlags();
  const std::size_t queries = system.registry.queries;
  react(&KELServer::reactToAppRegistrySeedingComplete);
  react(&KELServer::reactToAppRegistrySeedingComplete);
  EXPECT_EQ(newPosts(), 2U);
  react(&KELServer::reactToVigilChange);
  EXPECT_EQ(newPosts(), 3U);
  clearFlags();
  EXPECT_EQ(system.registry.queries, queries + 1);
  EXPECT_FALSE(system.journal.creations.empty());
}

class RunAsServerTest : public testing::Test {
 protected:
  /// Runs the server with `work` as its main loop.
  int serve(platform::Task work) {
    system.process.mainLoop = std::move(work);
    return run_as_server(system.platform);
  }

  /// A client's request over a connection of its own, from the process `peer`.
  ConduitReply ask(const PropertyListValue& contents, std::int64_t peer = 1) {
    system.conduit.nextPeer = peer;
    platform::SerialQueue queue("client");
    const auto connection = system.conduit.connect(endpointName, queue);
    connection->start();
    return connection->sendAndWait(contents);
  }

  static std::string failure(const ConduitReply& reply) {
    const auto* error = std::get_if<ConduitError>(&reply);
    return error ? error->description : "answered";
  }

  test::InMemoryPlatform system;
};

TEST_F(RunAsServerTest, SubscribesToItsStreamsInOrderAndExitsOnTermination) {
  const int status = serve([this] {
    EXPECT_TRUE(system.conduit.tracksActivity);
    EXPECT_THAT(system.launchEvents.streams,
                ElementsAre("com.orvex.beacond.matching", "com.orvex.broadcastd.matching",
                            "com.orvex.vigil.matching"));
    system.launchEvents.fire("com.orvex.broadcastd.matching");
    ask(get);
    EXPECT_GE(system.seeds.postsOf(seedName), 2U);
    system.process.termination();
    EXPECT_EQ(system.process.exitStatus, 0);
  });
  EXPECT_EQ(status, 0);
}

TEST_F(RunAsServerTest, ASecondServerSaysSoAndLeavesWithSuccess) {
  platform::SerialQueue queue("first");
  const auto first = system.conduit.listen(endpointName, queue, [](const auto&) {});
  EXPECT_EQ(serve([] { FAIL() << "served an endpoint that another server holds"; }), 0);
  EXPECT_THAT(system.log.take(), SizeIs(1));
}

TEST_F(RunAsServerTest, ASandboxedPeerGetsTheListAndIsRefusedTheRest) {
  system.sandbox.sandboxed = {7};
  system.sandbox.failing = {8};
  serve([this] {
    const ConduitReply list = ask(debugRequest("get_services_plist"), 7);
    ASSERT_EQ(failure(list), "answered");
    EXPECT_EQ(std::get<PropertyListValue>(list).asDictionary()->find("debug_output"), nullptr);
    EXPECT_EQ(failure(ask(localizations({"de"}), 7)), "answered");
    EXPECT_EQ(failure(ask(request("flush"), 8)), "answered") << "a failed question means not sandboxed";
    EXPECT_THAT(system.log.take(), IsEmpty());
    for (const char* command : {"flush", "get_and_update_services_plist"}) {
      EXPECT_EQ(failure(ask(request(command), 7)), "Connection interrupted");
      EXPECT_THAT(
          system.log.take(),
          ElementsAre("accept_conduit_connection: refusing request from sandboxed app 7: {\n    command = " +
                      std::string(command) + ";\n}\n"));
    }
  });
}

TEST_F(RunAsServerTest, ForeignMessagesCostOneLogLineEach) {
  serve([this] {
    const std::string unknown = "accept_conduit_connection: unknown Conduit message";
    for (const auto& [message, line] : std::vector<std::pair<PropertyListValue, std::string>>{
             {request("nonsense"), unknown + ": .*nonsense.*"},
             {localizations({"de", 1}), unknown + ": .*"},
             {"text", unknown + " type 0x[0-9a-f]+ for event: text\n"}}) {
      EXPECT_EQ(failure(ask(message)), "Connection interrupted");
      EXPECT_THAT(system.log.take(), ElementsAre(MatchesRegex(line)));
    }
    system.conduit.deliver(ConduitError{ConduitError::Kind::Other, "out of descriptors"});
    EXPECT_THAT(system.log.take(), ElementsAre("run_as_server: kel message error: out of descriptors"));
    EXPECT_EQ(failure(ask(get)), "answered");
  });
  EXPECT_THAT(system.log.take(), IsEmpty()) << "a peer that went away was logged";
}

}  // namespace
}  // namespace kel
