#include "server/server.h"

#include <limits>

#include "server/run_as_server.h"
#include "support/conduit_ends.h"
#include "support/in_memory_platform.h"
#include "support/property_lists.h"

namespace kel::test {
namespace {

using namespace std::chrono_literals;
using platform::ConduitError;
using testing::Not;

constexpr const char* seedName = "user.uid.501.com.orvex.qvservices.seed";
const std::string bundle = "/home/u/Library/Services/one.service";

Value request(const char* command) { return dictionary({{"command", command}}); }
const Value get = request("get_services_plist");
const Value update = request("get_and_update_services_plist");
const Value debugUpdate = dictionary({{"command", "get_and_update_services_plist"}, {"debug", true}});
Value localizations(Array names) { return dictionary({{"localizations", std::move(names)}}); }

class ServerTest : public testing::Test {
 protected:
  using Answer = std::shared_ptr<InMemoryMessage::Answer>;

  ServerTest() {
    system.clock.wallClock = 1'000'000;
    addBundle(system.files, bundle, information("org.a.one", "One"));
  }

  /// Waits until both queues have run what they hold, and what that queued.
  void drain() {
    for (int round = 0; round < 3; ++round) {
      server.conduitQueue().sync([] {});
      server.sync(true, [](KELDataStore&) {});
    }
    server.seedQueue().sync([] {});
  }

  /// Hands a request over as a connection would, without waiting for its answer.
  static Answer sendTo(KELServer& server, const Value& contents, bool wantsReply = true) {
    auto answer = std::make_shared<InMemoryMessage::Answer>();
    const Dictionary& entries = *contents.asDictionary();
    server.conduitQueue().sync([&] {
      server.conduitQueue().assertCurrent();
      server.performCommand(classify_request(entries),
                            std::make_shared<InMemoryMessage>(contents, wantsReply, answer),
                            wants_debug(entries), false);
    });
    return answer;
  }
  Answer send(const Value& contents) { return sendTo(server, contents); }

  /// Carries out a request and all that it queues.
  void perform(const Value& contents) {
    send(contents)->wait();
    drain();
  }

  static Dictionary replyOf(const Answer& answer) { return *std::get<Value>(answer->wait()).asDictionary(); }
  static std::string debugOutput(const Answer& answer) {
    return *replyOf(answer).find("debug_output")->asString();
  }
  static Value listIn(const Answer& answer) {
    return *platform::readPropertyList(**replyOf(answer).find("data")->asData()).value;
  }
  static Names titles(const Answer& answer) { return defaultTitles(listIn(answer)); }
  Names titles() { return titles(send(get)); }

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

  std::size_t posts() {
    server.seedQueue().sync([] {});
    return system.seeds.postsOf(seedName);
  }
  void setLists(const std::optional<Value>& lists) {
    server.setCurrentPublicDictionariesAllowingNotification(lists);
  }

  InMemoryPlatform system;
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

TEST_F(ServerTest, TheListAtHandIsAnsweredAtOnceEvenWhenItIsStale) {
  perform(update);
  react(&KELServer::reactToVigilChange);
  blockDataStore();
  EXPECT_THAT(titles(send(localizations({}))), ElementsAre("One"));
  EXPECT_THAT(titles(), ElementsAre("One"));
  release();
}

TEST_F(ServerTest, UpdatesQueuedAgainstOneGenerationRebuildOnceAndAllWaitForIt) {
  blockDataStore();
  std::vector<Answer> answers;
  for (int i = 0; i < 3; ++i) answers.push_back(send(debugUpdate));
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
  const Answer debugged = send(debugUpdate);
  EXPECT_FALSE(first->isThere());
  release();
  EXPECT_EQ(menuItem(listIn(first), 0), dictionary({{"default", "One"}, {"de", "Eins"}}));
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
  EXPECT_EQ(replyOf(send(request("flush"))), Dictionary());
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
  send(localizations({std::string(129, 'n'), "../x", "", "fr"}))->wait();
  EXPECT_THAT(server.knownLoadedLocalizations(), testing::Contains("fr"))
      << "what names nothing is passed over";
}

TEST_F(ServerTest, OddRequestsAreCarriedOutOrAnsweredAllTheSame) {
  sendTo(server, update, false);
  drain();
  EXPECT_NE(server.currentData(), nullptr);
  EXPECT_THAT(titles(send(dictionary({{"command", "nonsense"}}))), ElementsAre("One"));
  EXPECT_THAT(system.log.take(),
              ElementsAre(HasSubstr("KELServer::performCommand: unknown or invalid Conduit message: {")));
}

TEST_F(ServerTest, AnEqualListIsNeitherPublishedNorAnnounced) {
  const Value list = Array{dictionary({{"a", 1}})};
  setLists(std::nullopt);
  EXPECT_EQ(posts(), 0U) << "none over none";
  setLists(list);
  setLists(Array{dictionary({{"a", 1}})});
  EXPECT_EQ(posts(), 1U);
  Value tooDeep = 0;
  for (int level = 0; level < 600; ++level) tooDeep = Array{tooDeep};
  setLists(tooDeep);
  EXPECT_EQ(posts(), 1U) << "a list that cannot be written took the place of one that can";
  setLists(std::nullopt);
  EXPECT_EQ(posts(), 2U);
  EXPECT_EQ(server.currentData(), nullptr);
}

TEST(ServerSeedTest, IsKeptDrawnAtRandomAndNeverZero) {
  InMemoryPlatform kept, fresh;
  const auto seed = [](InMemoryPlatform& system) {
    return system.seeds.state(system.seeds.registerName(seedName));
  };
  kept.seeds.setState(kept.seeds.registerName(seedName), std::numeric_limits<std::uint64_t>::max());
  KELServer(kept.platform).incrementServicesSeed();
  EXPECT_EQ(seed(kept), 1U);

  fresh.facts.randomNumbers = {0, 0, 0xabcd, 0x1234};
  KELServer server(fresh.platform);
  EXPECT_EQ(seed(fresh), 0U) << "the drawn seed is not stored before the first change";
  server.incrementServicesSeed();
  server.seedQueue().sync([] {});
  EXPECT_EQ(seed(fresh), 0xabcd00001235U);
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

TEST_F(ReactorTest, OneChangeIsToldAtOnceTheNextAfterSixSecondsAndAClockSetBackCountsAsNoTime) {
  clearFlags();
  change();
  change();
  EXPECT_EQ(newPosts(), 1U) << "the flag was set, clients already know";
  clearFlags();
  advance(1s);
  change();
  change();
  advance(5s - 1ms);
  EXPECT_EQ(newPosts(), 0U);
  advance(1ms);
  EXPECT_EQ(newPosts(), 1U);

  clearFlags();
  system.clock.wallClock = 10;
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
  void serve(platform::Task work) {
    system.process.mainLoop = std::move(work);
    EXPECT_EQ(run_as_server(system.platform), 0);
  }

  /// What becomes of a client's request over a connection of its own, from the process `peer`.
  std::string ask(const Value& contents, std::int64_t peer = 1) {
    system.conduit.nextPeer = peer;
    const Value reply = SendingClient(system.conduit, endpointName).send(contents);
    return reply.asDictionary() ? "answered" : *reply.asString();
  }

  InMemoryPlatform system;
};

TEST_F(RunAsServerTest, ItsStreamsTellOfTheStartInTheirOrderAndOfChangesAfterwards) {
  serve([&] {
    EXPECT_THAT(system.launchEvents.streams,
                ElementsAre("com.orvex.beacond.matching", "com.orvex.broadcastd.matching",
                            "com.orvex.vigil.matching"));
    system.launchEvents.fire.at("com.orvex.broadcastd.matching")();
    ask(request("nonsense"));
  });
  EXPECT_EQ(system.seeds.postsOf(seedName), 4U);
}

TEST_F(RunAsServerTest, WhatASandboxedPeerIsRefusedCostsALogLineAndAFailedQuestionMeansNone) {
  system.sandbox.answers = {{7, 1}, {8, -1}};
  serve([this] {
    EXPECT_EQ(ask(request("flush"), 8), "answered");
    EXPECT_EQ(ask(get, 7), "answered");
    EXPECT_THAT(system.log.take(), IsEmpty());
    EXPECT_EQ(ask(request("flush"), 7), "Connection interrupted");
    EXPECT_THAT(system.log.take(), ElementsAre("accept_conduit_connection: refusing request from sandboxed "
                                               "app 7: {\n    command = flush;\n}\n"));
  });
}

TEST_F(RunAsServerTest, ForeignMessagesCostOneLogLineEach) {
  serve([this] {
    const std::string unknown = "accept_conduit_connection: unknown Conduit message";
    for (const auto& [message, line] : std::vector<std::pair<Value, std::string>>{
             {request("nonsense"), unknown + ": .*nonsense.*"},
             {localizations({"de", 1}), unknown + ": .*"},
             {localizations(Array(65, "de")), ".*refusing request for more than 64 localizations\n"},
             {"text", unknown + " type 0x[0-9a-f]+ for event: text\n"}}) {
      EXPECT_EQ(ask(message), "Connection interrupted");
      EXPECT_THAT(system.log.take(), ElementsAre(MatchesRegex(line)));
    }
    system.conduit.deliver(ConduitError{ConduitError::Kind::Other, "out of descriptors"});
    EXPECT_THAT(system.log.take(), ElementsAre("run_as_server: kel message error: out of descriptors"));
    EXPECT_EQ(ask(get), "answered");
  });
  EXPECT_THAT(system.log.take(), IsEmpty()) << "a peer that went away was logged";
}

}  // namespace
}  // namespace kel::test
