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

constexpr const char* seedName = "user.uid.501.com.orvex.qvservices.seed";
const std::string bundle = "/home/u/Library/Services/one.service";

Value request(const char* command) { return dictionary({{"command", command}}); }
const Value get = request("get_services_plist");
const Value update = request("get_and_update_services_plist");
const Value debugUpdate = dictionary({{"command", "get_and_update_services_plist"}, {"debug", true}});
Value localizations(Array names) { return dictionary({{"localizations", std::move(names)}}); }

struct ServerTest : testing::Test {
  using Answer = std::shared_ptr<InMemoryMessage::Answer>;

  ServerTest() {
    system.clock.wallClock = 1'000'000;
    addBundle(system.files, bundle, information("org.a.one", "One"));
  }

  /// Waits until both queues have run what they hold, and what that queued.
  void drain() {
    for (int round = 0; round < 3; ++round) {
      server->conduitQueue().sync([] {});
      server->sync(true, [](KELDataStore&) {});
    }
    server->seedQueue().sync([] {});
  }

  /// Hands a request over as a connection would, without waiting for its answer.
  Answer send(const Value& contents, bool wantsReply = true) {
    auto answer = std::make_shared<InMemoryMessage::Answer>();
    const Dictionary& entries = *contents.asDictionary();
    server->conduitQueue().sync([&] {
      server->conduitQueue().assertCurrent();
      server->performCommand(classify_request(entries),
                             std::make_shared<InMemoryMessage>(contents, wantsReply, answer),
                             wants_debug(entries), false);
    });
    return answer;
  }

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
  Names titles() { return defaultTitles(listIn(send(get))); }

  void react(void (KELServer::*reaction)()) {
    server->conduitQueue().sync([&] { ((*server).*reaction)(); });
    drain();
  }
  std::size_t posts() {
    server->seedQueue().sync([] {});
    return system.seeds.postsOf(seedName);
  }

  InMemoryPlatform system;
  std::optional<KELServer> server{std::in_place, system.platform};
};

TEST_F(ServerTest, TheFirstRequestQueuesAFullRebuildOnlyWhenTheCacheIsNotOfThisBoot) {
  EXPECT_THAT(titles(), IsEmpty());
  drain();
  EXPECT_THAT(titles(), ElementsAre("One"));
  server->sync(true, [](KELDataStore& store) { store.writeCaches(); });
  server.emplace(system.platform);
  EXPECT_THAT(titles(), ElementsAre("One"));
  drain();
  EXPECT_EQ(system.registry.queries, 1U);
}

TEST_F(ServerTest, WhatIsAtHandIsAnsweredAtOnceAndRebuildsWaitAndAreDoneOnceUnlessForNewLocalizations) {
  addMenuStrings(system.files, bundle, "de", dictionary({{"One", "Eins"}}));
  EXPECT_THAT(debugOutput(send(debugUpdate)), HasSubstr("Updating Services cache\nLoading cache from "));
  react(&KELServer::reactToVigilChange);
  platform::Semaphore gate;
  server->sync(false, [&](KELDataStore&) { gate.wait(60s); });
  EXPECT_THAT(titles(), ElementsAre("One")) << "stale as it is";
  const Answer rebuilt = send(debugUpdate), translated = send(localizations({"de", "fr"}));
  const Answer coalesced = send(debugUpdate);
  EXPECT_FALSE(rebuilt->isThere() || translated->isThere() || coalesced->isThere());
  EXPECT_THAT(server->knownLoadedLocalizations(), ElementsAre("de"));
  EXPECT_TRUE(send(localizations({"de", "xx"}))->isThere());
  EXPECT_TRUE(send(localizations({}))->isThere());
  send(request("flush"));
  const Answer afterFlush = send(debugUpdate);
  gate.signal();
  EXPECT_EQ(menuItem(listIn(translated), 0), dictionary({{"default", "One"}, {"de", "Eins"}}));
  EXPECT_EQ(debugOutput(coalesced), "Coalescing Services update (gen counts were 1/3");
  EXPECT_EQ(menuItem(listIn(coalesced), 0), menuItem(listIn(translated), 0));
  EXPECT_THAT(debugOutput(afterFlush), StartsWith("Updating Services cache"));
}

TEST_F(ServerTest, AFlushIsAnsweredWithoutDataAndOutlivesARebuildThatWasUnderWay) {
  perform(localizations({"de"}));
  server->sync(true, [](KELDataStore& store) { store.writeCaches(); });
  platform::Semaphore gate;
  server->sync(false, [&](KELDataStore&) { gate.wait(60s); });
  const Answer rebuilt = send(update);
  EXPECT_EQ(replyOf(send(request("flush"))), Dictionary());
  EXPECT_THAT(server->knownLoadedLocalizations(), IsEmpty());
  gate.signal();
  EXPECT_THAT(defaultTitles(listIn(rebuilt)), ElementsAre("One"));
  drain();
  EXPECT_EQ(server->currentData(), nullptr);
  EXPECT_FALSE(system.files.isFile(cachePath));
}

TEST_F(ServerTest, ClientsThatAskForEverNewLocalizationsDisplaceOthersAndShutNobodyOut) {
  for (int i = 0; i < 300; ++i) send(localizations({"x" + std::to_string(i)}))->wait();
  send(localizations({"de"}))->wait();
  EXPECT_THAT(server->knownLoadedLocalizations(), testing::AllOf(SizeIs(256), testing::Contains("de")));
  send(localizations({std::string(129, 'n'), "../x", "", "fr"}))->wait();
  EXPECT_THAT(server->knownLoadedLocalizations(), testing::Contains("fr"))
      << "what names nothing is passed over";
}

TEST_F(ServerTest, OddRequestsAreCarriedOutOrAnsweredAllTheSame) {
  send(update, false);
  drain();
  EXPECT_THAT(defaultTitles(listIn(send(request("nonsense")))), ElementsAre("One"));
  EXPECT_THAT(system.log.take(),
              ElementsAre(HasSubstr("KELServer::performCommand: unknown or invalid Conduit message: {")));
}

TEST_F(ServerTest, AnEqualListIsNotAnnouncedAndOneThatCannotBeWrittenIsNone) {
  Value tooDeep = 0;
  for (int level = 0; level < 600; ++level) tooDeep = Array{tooDeep};
  const std::optional<Value> list = Array{dictionary({{"a", 1}})}, equal = Array{dictionary({{"a", 1}})};
  using Row = std::pair<std::optional<Value>, std::size_t>;
  for (const auto& [next, expected] :
       {Row{std::nullopt, 0}, Row{list, 1}, Row{equal, 1}, Row{tooDeep, 1}, Row{std::nullopt, 2}}) {
    server->setCurrentPublicDictionariesAllowingNotification(next);
    EXPECT_EQ(posts(), expected);
  }
  EXPECT_EQ(server->currentData(), nullptr);
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

struct ReactorTest : ServerTest {
  /// What a request does with the flags: it clears them.
  void clearFlags() {
    perform(get);
    before = posts();
  }
  std::size_t newPosts() { return posts() - before; }
  void change() { react(&KELServer::reactToAppRegistryDatabaseChange); }
  /// Expects that the change is told when `delay` has passed, and not before.
  void expectPostAfter(std::chrono::nanoseconds delay) {
    system.clock.advance(delay - 1ms);
    drain();
    EXPECT_EQ(newPosts(), 0U);
    system.clock.advance(1ms);
    drain();
    EXPECT_EQ(newPosts(), 1U);
    clearFlags();
  }

  std::size_t before = 0;
};

TEST_F(ReactorTest, OneChangeIsToldAtOnceTheNextAfterSixSecondsAndAClockSetBackCountsAsNoTime) {
  clearFlags();
  change();
  change();
  EXPECT_EQ(newPosts(), 1U) << "the flag was set, clients already know";
  clearFlags();
  system.clock.advance(1s);
  change();
  change();
  expectPostAfter(5s);
  system.clock.wallClock = 10;
  change();
  expectPostAfter(6s);
  system.clock.advance(1h);
  change();
  EXPECT_EQ(newPosts(), 1U) << "delayed after a long quiet";
}

TEST_F(ReactorTest, SeedingCompleteIsToldEveryTimeAndTheNextRequestAsksTheRegistryAgain) {
  clearFlags();
  const std::size_t queries = system.registry.queries;
  for (int time = 0; time < 2; ++time) react(&KELServer::reactToAppRegistrySeedingComplete);
  EXPECT_EQ(newPosts(), 2U);
  clearFlags();
  EXPECT_EQ(system.registry.queries, queries + 1);
}

struct RunAsServerTest : testing::Test {
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

TEST_F(RunAsServerTest, WhatIsRefusedCostsOneLogLineAndAFailedQuestionAboutThePeerMeansNone) {
  system.sandbox.answers = {{7, 1}, {8, -1}};
  const std::string accept = "accept_conduit_connection: ", unknown = accept + "unknown Conduit message";
  serve([&, this] {
    for (const auto& [peer, message, line] : std::vector<std::tuple<std::int64_t, Value, std::string>>{
             {7, request("flush"),
              accept + "refusing request from sandboxed app 7: .\n    command = flush;\n.\n"},
             {1, request("nonsense"), unknown + ": .*nonsense.*"},
             {1, localizations({"de", 1}), unknown + ": .*"},
             {1, localizations(Array(65, "de")),
              accept + "refusing request for more than 64 localizations\n"},
             {1, "text", unknown + " type 0x[0-9a-f]+ for event: text\n"}}) {
      EXPECT_EQ(ask(message, peer), "Connection interrupted");
      EXPECT_THAT(system.log.take(), ElementsAre(MatchesRegex(line)));
    }
    system.conduit.deliver(ConduitError{ConduitError::Kind::Other, "out of descriptors"});
    EXPECT_THAT(system.log.take(), ElementsAre("run_as_server: kel message error: out of descriptors"));
    EXPECT_EQ(ask(request("flush"), 8) + ask(get, 7) + ask(get, 1), "answeredansweredanswered");
  });
  EXPECT_THAT(system.log.take(), IsEmpty()) << "a peer that went away was logged";
}

}  // namespace
}  // namespace kel::test
