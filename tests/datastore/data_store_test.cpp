#include "datastore/data_store.h"

#include <regex>

#include "datastore/boot_session.h"
#include "support/debug_lines.h"
#include "support/in_memory_platform.h"
#include "support/property_lists.h"

namespace kel::test {
namespace {

const std::string services = "/home/u/Library/Services/";
const std::string one = services + "one.service";
const std::string two = services + "two.service";

/// Debug lines without the entries' addresses.
std::string lines(const std::function<void()>& work) {
  return std::regex_replace(debugLines(work), std::regex("<KELAppEntry: [^>]*>"), "<entry>");
}

struct DataStoreTest : testing::Test {
  DataStoreTest() {
    addService("one", "One");
    addService("two", "Two");
    addApplication("/Applications/App.app", information("org.a.app", "App"));
    system.files.addPropertyList(restrictionsPath, dictionary({}));
    restart();
  }

  void restart() { store = KELDataStore::initWithSystemServices(system.platform); }
  void addService(const std::string& name, const std::string& title) {
    addBundle(system.files, services + name + ".service", information("org.a." + name, title));
  }
  void addApplication(const std::string& path, const Dictionary& declared) {
    addBundle(system.files, path, declared);
    system.registry.registered.push_back({path});
  }
  Names titles() { return defaultTitles(store->currentPublicDictionaries()); }
  std::string update(KELStaleCacheFlags flags) {
    return lines([&] { store->updateServicesCache(flags); });
  }

  /// Updates everything, writes the cache file and ends the store.
  std::string writeCache() {
    update(KELStaleEverything);
    return debugLines([this] {
      store->writeCaches();
      store.reset();
    });
  }
  Dictionary cacheFile() {
    return *platform::readDictionaryFile(system.files, cachePath, platform::largestOwnFile).dictionary;
  }

  InMemoryPlatform system;
  std::unique_ptr<KELDataStore> store;
};

TEST_F(DataStoreTest, TheFirstUpdateReadsEverySourceAndSaysSo) {
  const std::string told = update(0);
  for (const std::string& part :
       {"Loading cache from " + cachePath + "\nCache at " + cachePath +
            " came back nil (file does NOT exist)\nCache contains 0 keys\n0 path(s) from AppRegistry",
        std::string("Service providing paths:\n\t/Applications/App.app"), "Scanning directory: " + services,
        std::string("Scanning directory: /OrvexInternal/Applications/"),
        std::string("Creating entry <entry> for path /Applications/App.app")})
    EXPECT_THAT(told, HasSubstr(part));
  EXPECT_THAT(titles(), ElementsAre("App", "One", "Two"));
  EXPECT_EQ(lines([&] { store->fetchLocalizations(std::nullopt); }), "");
  EXPECT_THAT(lines([&] {
                store->fetchLocalizations(Names{"French", "German"});
              }),
              StartsWith("Fetching localization(s): French, German"));
}

TEST_F(DataStoreTest, ARestartFromTheCacheListsNoDirectoryOpensNoBundleAndGivesTheSameList) {
  update(KELStaleEverything);
  const Value list = store->currentPublicDictionaries();
  writeCache();
  system.files.forgetUses();
  const int opens = system.bundles.opens;

  restart();
  EXPECT_TRUE(store->cacheIsFromThisBootSession());
  EXPECT_EQ(store->currentPublicDictionaries(), list);
  EXPECT_THAT(update(KELStaleServiceDirectories), HasSubstr("No changes!\nCache valid for directory "));
  EXPECT_EQ(store->currentPublicDictionaries(), list);
  EXPECT_EQ(system.bundles.opens, opens);
  EXPECT_EQ(system.files.uses(services), 0U);
}

TEST_F(DataStoreTest, TheCacheFileHoldsExactlyItsKeysAndSurvivesAFailedWrite) {
  EXPECT_THAT(writeCache(), MatchesRegex("Wrote out cache file \\([0-9]+ bytes\\)"));
  const Dictionary cache = cacheFile();
  std::string keys;
  for (const auto& [key, value] : cache) keys += key.text() + " ";
  EXPECT_EQ(keys,
            "QVServicesARPaths QVServicesBuildVersion QVServicesExplicitDirectoryCache "
            "QVServicesLastEventID QVServicesRestrictionLists QVServicesSessionID ServicesCache ");
  EXPECT_EQ(*cache.find("QVServicesSessionID"), "1700000000,100004");
  EXPECT_EQ(*cache.find("QVServicesLastEventID"), 1000);
  EXPECT_EQ(*cache.find("QVServicesARPaths"), (Array{"/Applications/App.app"}));
  EXPECT_EQ(cache.find("ServicesCache")->asDictionary()->size(), 3U);
  EXPECT_EQ(system.transactions.openCount, 0);

  system.files.failNextWrite("Disk full");
  restart();
  EXPECT_EQ(debugLines([&] { store->writeCaches(), store.reset(); }),
            "Failed to write cache file: Disk full");
  EXPECT_EQ(cacheFile(), cache);

  restart();
  system.files.removeTree(restrictionsPath);
  store->writeCaches();
  store->flushCaches();
  EXPECT_FALSE(system.files.isFile(cachePath)) << "a deletion overtook the write queued before it";
}

TEST_F(DataStoreTest, ADamagedOrForeignCacheIsLeftOutAsFarAsItIsWrong) {
  const std::string foreign =
      "Ignoring cache because it has the wrong version\nCache contains 0 keys\n0 path(s)";
  const auto entries = dictionary({{"/x", "text"}, {"/y", dictionary({{"bundle_id", "org.cached"}})}});
  const Dictionary::Entry current{"QVServicesBuildVersion", "linux 1"};
  for (const auto& [fields, expected] : std::vector<std::pair<Entries, std::string>>{
           {{{"QVServicesBuildVersion", "linux 2"}, {"QVServicesLastEventID", 5}}, foreign},
           {{{"QVServicesBuildVersion", 1}}, foreign},
           {{current, {"QVServicesLastEventID", "5"}}, "Cache read OK\nCache contains 2 keys\n0 path(s)"},
           {{current, {"QVServicesLastEventID", 5}}, "2 keys\nEventStreamID was 5\n0 path(s)"},
           {{current, {"ServicesCache", entries}}, "AppRegistry\nLoaded cached entry <entry> for path /y"},
           {{current,
             {"QVServicesARPaths", "text"},
             {"QVServicesRestrictionLists", 1},
             {"QVServicesExplicitDirectoryCache", dictionary({{services, "text"}})},
             {"ServicesCache", Array{}}},
            "Cache contains 5 keys\n0 path(s) from AppRegistry"}}) {
    system.files.addPropertyList(cachePath, dictionary(fields));
    restart();
    EXPECT_THAT(lines([&] { store->loadCache(); }), HasSubstr(expected));
    EXPECT_FALSE(store->cacheIsFromThisBootSession()) << expected;
    EXPECT_THAT(titles(), IsEmpty()) << expected;
  }
  system.files.addText(cachePath, "bplist00 but no more");
  restart();
  EXPECT_THAT(lines([&] { store->loadCache(); }), HasSubstr("came back nil (file does exist)"));
}

TEST_F(DataStoreTest, TheBootSessionIsKeptForTheProcessAndComparedWithTheCache) {
  writeCache();
  using Row = std::tuple<std::int64_t, std::int64_t, bool>;
  for (const auto& [boot, session, isSame] :
       {Row{1700000000, 100004, true}, Row{1700000001, 100004, false}, Row{1700000000, -1, false}}) {
    InMemoryPlatform later;
    later.files.addFile(cachePath, system.files.contents(cachePath).value());
    later.facts.boot.value = boot;
    later.facts.session.value = session;
    const auto own = KELDataStore::initWithSystemServices(later.platform);
    EXPECT_EQ(own->cacheIsFromThisBootSession(), isSame) << boot;
  }

  InMemoryPlatform broken;
  broken.facts.boot = {std::nullopt, 2, "No such file or directory"};
  broken.facts.session = {std::nullopt, 1, "Operation not permitted"};
  std::string identity;
  EXPECT_EQ(debugLines([&] { identity = boot_session_id(broken.platform); }),
            "sysctlbyname(\"kern.boottime\") failed with errno 2 (No such file or directory)\n"
            "getaudit_addr() failed with errno 1 (Operation not permitted)");
  broken.facts.boot = {5, 0, {}};
  EXPECT_EQ(debugLines([&] { EXPECT_EQ(boot_session_id(broken.platform), identity); }), "");
  EXPECT_EQ(identity, "0,0");
}

TEST_F(DataStoreTest, FlagsAndTheJournalSayWhatIsReadAgainAndAFlushKeepsTheRegistry) {
  const auto uses = [&](const std::string& path) { return system.files.uses(path); };
  update(KELStaleEverything);
  system.files.forgetUses();
  const std::size_t queries = system.registry.queries;
  addApplication("/Applications/New.app", information("org.a.new", "New"));
  addService("three", "Three");
  addService("two", "Changed");
  system.journal.record(services + "three.service/Info.plist");

  update(8 | 16);  // which name no source
  EXPECT_THAT(titles(), ElementsAre("App", "One", "Two"));
  EXPECT_TRUE(system.registry.queries == queries && system.journal.creations.empty());
  update(KELStaleAppRegistryPaths);
  EXPECT_THAT(titles(), ElementsAre("App", "New", "One", "Two"));
  EXPECT_EQ(uses(services), 0U);
  update(KELStaleServiceDirectories);
  EXPECT_THAT(titles(), ElementsAre("App", "New", "One", "Three", "Two"));
  EXPECT_EQ(system.journal.creations.back().since, 1000U);
  system.files.forgetUses();
  system.journal.record(two + "/Info.plist");
  update(KELStaleServiceDirectories);
  EXPECT_THAT(titles(), ElementsAre("App", "New", "One", "Three", "Changed"));
  EXPECT_THAT(Array({uses(services), uses(one + "/Info.plist"), uses(two + "/Info.plist")}),
              ElementsAre(0, 0, 1));
  EXPECT_EQ(system.journal.creations.back().since, 1001U) << "resumes where the last update began";
  system.journal.available = false;
  EXPECT_THAT(update(KELStaleServiceDirectories), HasSubstr("VigilStream failed!"));
  EXPECT_EQ(uses(services) + uses(one + "/Info.plist"), 2U);
  store->flushCaches();
  EXPECT_THAT(update(0), HasSubstr("Scanning directory: " + services));
  EXPECT_EQ(system.registry.queries, queries + 1);
}

TEST_F(DataStoreTest, ABundleThatStopsLoadingDropsOutAndIsTriedAgain) {
  update(KELStaleEverything);
  addBundle(system.files, one, dictionary({{"KTBundleName", 5}}));
  system.journal.record(one + "/Info.plist");
  update(KELStaleServiceDirectories);
  EXPECT_THAT(titles(), ElementsAre("App", "Two"));
  EXPECT_THAT(system.log.take(), ElementsAre(HasSubstr("Malformed Services entries in Info.plist")));
  addService("one", "Mended");
  EXPECT_THAT(update(0), HasSubstr("Creating entry <entry> for path " + one));
  EXPECT_THAT(titles(), ElementsAre("App", "Mended", "Two"));
}

TEST_F(DataStoreTest, CopiesAreDecidedArchivesSkippedAndEntriesWithoutIdentifierSortAsNull) {
  addApplication("/B/Old.tqarchive/X.app", information("org.a.x", "X"));
  addApplication("/Applications/Copy of One.app", information("org.a.one", "Loser"));
  for (const std::string identifier : {"!first", "0digit"})
    addBundle(system.files, services + identifier, information(identifier, identifier));
  const Array nameless{service("Nameless"), service("Also nameless")};
  addBundle(system.files, services + "nameless.service", dictionary({{"QVServices", nameless}}));
  const std::string told = update(KELStaleEverything);
  EXPECT_THAT(told, HasSubstr("Skipping file inside .tqarchive: /B/Old.tqarchive/X.app"));
  EXPECT_THAT(titles(), ElementsAre("!first", "Nameless", "Also nameless", "0digit", "App", "One", "Two"));
  EXPECT_THAT(debugLines([&] { store->uniquedAppEntries(); }),
              HasSubstr("Collision resolution: preferring " + one +
                        " to /Applications/Copy of One.app due to directory precedence"));
}

TEST_F(DataStoreTest, SpellCheckersSurviveOnlyWhereTheyMayLive) {
  for (const auto& [path, title] : std::vector<std::pair<std::string, std::string>>{
           {services + "s.service", "user"},
           {"/OrvexInternal/Library/Services/s.service", "internal"},
           {"/home/u/Library/Services2/s.app", "sibling"},
           {"/Applications/s.app", "application"}}) {
    DictionaryBuilder spellChecker(service(title));
    spellChecker.set("QVSpellChecker", "checker");
    const Array declared{spellChecker.build(), service(title + " plain")};
    addBundle(system.files, path, dictionary({{"KTBundleIdentifier", title}, {"QVServices", declared}}));
    if (path.ends_with(".app")) system.registry.registered.push_back({path});
  }
  update(KELStaleEverything);
  EXPECT_THAT(titles(), ElementsAre("application plain", "internal plain", "App", "One", "Two", "sibling",
                                    "sibling plain", "user", "user plain"));
}

TEST_F(DataStoreTest, RestrictionsAreReadAgainOnlyWhenToldAndKeptWhenTheFileIsGone) {
  addBundle(system.files, one, information("com.orvex.one", "One"));
  const auto expectRestricted = [&](bool expected, KELStaleCacheFlags flags) {
    update(flags);
    const Dictionary first = *store->currentPublicDictionaries().asArray()->front().asDictionary();
    EXPECT_EQ(first.find("QVRestricted") != nullptr, expected) << flags;
  };
  expectRestricted(true, KELStaleEverything);
  const Array row{dictionary({{"QVBundleID", "com.orvex.one"}, {"QVMenuItem", "One"}})};
  system.files.addPropertyList(restrictionsPath, dictionary({{"QVUnrestricted", row}}));
  expectRestricted(true, KELStaleAppRegistryPaths);
  expectRestricted(false, KELStaleRestrictionLists);
  system.files.removeTree(restrictionsPath);
  expectRestricted(false, KELStaleRestrictionLists);
}

}  // namespace
}  // namespace kel::test
