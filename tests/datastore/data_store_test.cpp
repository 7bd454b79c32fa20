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

std::unique_ptr<KELDataStore> makeStore(InMemoryPlatform& system) {
  return KELDataStore::initWithSystemServices(system.platform);
}

Names titles(KELDataStore& store) { return defaultTitles(store.currentPublicDictionaries()); }

/// Debug lines without the entries' addresses.
std::string lines(const std::function<void()>& work) {
  return std::regex_replace(debugLines(work), std::regex("<KELAppEntry: [^>]*>"), "<entry>");
}

class DataStoreTest : public testing::Test {
 protected:
  DataStoreTest() {
    addBundle(system.files, one, information("org.a.one", "One"));
    addBundle(system.files, two, information("org.a.two", "Two"));
    addApplication("/Applications/App.app", information("org.a.app", "App"));
    system.files.addPropertyList(restrictionsPath, dictionary({}));
  }

  void addApplication(const std::string& path, const Dictionary& declared) {
    addBundle(system.files, path, declared);
    system.registry.registered.push_back({path});
  }

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
  std::unique_ptr<KELDataStore> store = makeStore(system);
};

TEST_F(DataStoreTest, TheFirstUpdateReadsEverySourceAndSaysSo) {
  const std::string told = update(0);
  EXPECT_THAT(told, HasSubstr("Loading cache from " + cachePath + "\nCache at " + cachePath +
                              " came back nil (file does NOT exist)\nCache contains 0 keys\n"
                              "0 path(s) from AppRegistry"));
  EXPECT_THAT(told, HasSubstr("Service providing paths:\n\t/Applications/App.app"));
  EXPECT_THAT(told, HasSubstr("Scanning directory: " + services));
  EXPECT_THAT(told, HasSubstr("Scanning directory: /OrvexInternal/Applications/"));
  EXPECT_THAT(told, HasSubstr("Creating entry <entry> for path /Applications/App.app"));
  EXPECT_THAT(titles(*store), ElementsAre("App", "One", "Two"));
  EXPECT_EQ(lines([&] { store->fetchLocalizations(std::nullopt); }), "");
  const std::string fetched = lines([&] { store->fetchLocalizations(Names{"French", "German"}); });
  EXPECT_THAT(fetched, StartsWith("Fetching localization(s): French, German"));
}

TEST_F(DataStoreTest, ARestartFromTheCacheListsNoDirectoryOpensNoBundleAndGivesTheSameList) {
  update(KELStaleEverything);
  const Value list = store->currentPublicDictionaries();
  writeCache();
  system.files.forgetUses();
  const int opens = system.bundles.opens;

  store = makeStore(system);
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
  Names keys;
  for (const auto& [key, value] : cache) keys.push_back(key.text());
  EXPECT_THAT(keys, ElementsAre("QVServicesARPaths", "QVServicesBuildVersion",
                                "QVServicesExplicitDirectoryCache", "QVServicesLastEventID",
                                "QVServicesRestrictionLists", "QVServicesSessionID", "ServicesCache"));
  EXPECT_EQ(*cache.find("QVServicesSessionID"), "1700000000,100004");
  EXPECT_EQ(*cache.find("QVServicesLastEventID"), 1000);
  EXPECT_EQ(*cache.find("QVServicesARPaths"), (Array{"/Applications/App.app"}));
  EXPECT_EQ(cache.find("ServicesCache")->asDictionary()->size(), 3U);
  EXPECT_EQ(system.transactions.openCount, 0);

  system.files.failNextWrite("Disk full");
  EXPECT_EQ(debugLines([&] { makeStore(system)->writeCaches(); }), "Failed to write cache file: Disk full");
  EXPECT_EQ(cacheFile(), cache);

  store = makeStore(system);
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
    const auto own = makeStore(system);
    EXPECT_THAT(lines([&] { own->loadCache(); }), HasSubstr(expected));
    EXPECT_FALSE(own->cacheIsFromThisBootSession()) << expected;
    EXPECT_THAT(titles(*own), IsEmpty()) << expected;
  }
  system.files.addText(cachePath, "bplist00 but no more");
  EXPECT_THAT(lines([&] { makeStore(system)->loadCache(); }), HasSubstr("came back nil (file does exist)"));
}

TEST_F(DataStoreTest, TheBootSessionIsKeptForTheProcessAndComparedWithTheCache) {
  writeCache();
  const auto sameSystemLater = [&](auto change) {
    InMemoryPlatform later;
    later.files.addFile(cachePath, system.files.contents(cachePath).value());
    change(later.facts);
    return makeStore(later)->cacheIsFromThisBootSession();
  };
  EXPECT_TRUE(sameSystemLater([](auto&) {}));
  EXPECT_FALSE(sameSystemLater([](InMemoryFacts& facts) { facts.boot.value = 1700000001; }));
  EXPECT_FALSE(sameSystemLater([](InMemoryFacts& facts) { facts.session.value = -1; }));

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

TEST_F(DataStoreTest, FlagsSayWhichSourcesAreReadAgainAndAFlushKeepsTheRegistry) {
  update(KELStaleEverything);
  system.files.forgetUses();
  const std::size_t queries = system.registry.queries;
  addApplication("/Applications/New.app", information("org.a.new", "New"));
  addBundle(system.files, services + "three.service", information("org.a.three", "Three"));
  system.journal.record(services + "three.service/Info.plist");

  update(0);
  EXPECT_THAT(titles(*store), ElementsAre("App", "One", "Two"));
  EXPECT_TRUE(system.journal.creations.empty());
  update(8 | 16);
  EXPECT_EQ(system.registry.queries, queries);
  update(KELStaleAppRegistryPaths);
  EXPECT_THAT(titles(*store), ElementsAre("App", "New", "One", "Two"));
  EXPECT_EQ(system.files.uses(services), 0U);
  update(KELStaleServiceDirectories);
  EXPECT_THAT(titles(*store), ElementsAre("App", "New", "One", "Three", "Two"));
  EXPECT_EQ(system.files.uses(one + "/Info.plist"), 0U);
  EXPECT_EQ(system.journal.creations.back().since, 1000U);
  update(KELStaleServiceDirectories);
  EXPECT_EQ(system.journal.creations.back().since, 1001U) << "resumes where the last update began";
  store->flushCaches();
  EXPECT_THAT(update(0), HasSubstr("Scanning directory: " + services));
  EXPECT_EQ(system.registry.queries, queries + 1);
}

TEST_F(DataStoreTest, AChangeInsideAKnownBundleReloadsThatBundleUnlessTheJournalFails) {
  update(KELStaleEverything);
  system.files.forgetUses();
  addBundle(system.files, two, information("org.a.two", "Changed"));
  system.journal.record(two + "/Info.plist");
  update(KELStaleServiceDirectories);
  EXPECT_THAT(titles(*store), ElementsAre("App", "One", "Changed"));
  EXPECT_EQ(system.files.uses(two + "/Info.plist"), 1U);
  EXPECT_EQ(system.files.uses(one + "/Info.plist"), 0U);
  EXPECT_EQ(system.files.uses(services), 0U);

  system.journal.available = false;
  EXPECT_THAT(update(KELStaleServiceDirectories), HasSubstr("VigilStream failed!"));
  EXPECT_EQ(system.files.uses(services), 1U);
  EXPECT_EQ(system.files.uses(one + "/Info.plist"), 1U);
}

TEST_F(DataStoreTest, BundlesThatVanishOrStopLoadingDropOutAndAreTriedAgain) {
  update(KELStaleEverything);
  addBundle(system.files, one, dictionary({{"KTBundleName", 5}}));
  system.files.removeTree(two);
  for (const std::string& changed : {one + "/Info.plist", two, services + "."})
    system.journal.record(changed);
  update(KELStaleServiceDirectories);
  EXPECT_THAT(titles(*store), ElementsAre("App"));
  EXPECT_THAT(system.log.take(), ElementsAre(HasSubstr("Malformed Services entries in Info.plist")));
  addBundle(system.files, one, information("org.a.one", "Mended"));
  EXPECT_THAT(update(0), HasSubstr("Creating entry <entry> for path " + one));
  EXPECT_THAT(titles(*store), ElementsAre("App", "Mended"));
}

TEST_F(DataStoreTest, CopiesAreDecidedArchivesSkippedAndEntriesWithoutIdentifierSortAsNull) {
  addApplication("/B/Old.tqarchive/X.app", information("org.a.x", "X"));
  addApplication("/Applications/Copy of One.app", information("org.a.one", "Loser"));
  for (const std::string identifier : {"!first", "0digit"})
    addBundle(system.files, services + identifier + ".service", information(identifier, identifier));
  const Array nameless{service("Nameless"), service("Also nameless")};
  addBundle(system.files, services + "nameless.service", dictionary({{"QVServices", nameless}}));
  const std::string told = debugLines([&] {
    store->updateServicesCache(KELStaleEverything);
    EXPECT_THAT(titles(*store),
                ElementsAre("!first", "Nameless", "Also nameless", "0digit", "App", "One", "Two"));
  });
  EXPECT_THAT(told, HasSubstr("Skipping file inside .tqarchive: /B/Old.tqarchive/X.app"));
  EXPECT_THAT(told, HasSubstr("Collision resolution: preferring " + one +
                              " to /Applications/Copy of One.app due to directory precedence"));
}

TEST_F(DataStoreTest, SpellCheckersSurviveOnlyWhereTheyMayLive) {
  const auto spellChecker = [](const std::string& title) {
    DictionaryBuilder declared(service(title));
    declared.set("QVSpellChecker", "checker");
    return Array{declared.build(), service(title + " plain")};
  };
  for (const auto& [path, title] : std::vector<std::pair<std::string, std::string>>{
           {"/home/u/Library/Services/s.service", "user"},
           {"/OrvexInternal/Library/Services/s.service", "internal"},
           {"/home/u/Library/Services2/s.app", "sibling"},
           {"/Applications/s.app", "application"}}) {
    const auto declared = dictionary({{"KTBundleIdentifier", title}, {"QVServices", spellChecker(title)}});
    addBundle(system.files, path, declared);
    if (path.ends_with(".app")) system.registry.registered.push_back({path});
  }
  update(KELStaleEverything);
  EXPECT_THAT(titles(*store), ElementsAre("application plain", "internal plain", "App", "One", "Two",
                                          "sibling", "sibling plain", "user", "user plain"));
}

TEST_F(DataStoreTest, RestrictionsAreReadAgainOnlyWhenTold) {
  addBundle(system.files, one, information("com.orvex.one", "One"));
  const auto isRestricted = [&] {
    const Value list = store->currentPublicDictionaries();
    return list.asArray()->front().asDictionary()->find("QVRestricted") != nullptr;
  };
  update(KELStaleEverything);
  EXPECT_TRUE(isRestricted());
  const Array row{dictionary({{"QVBundleID", "com.orvex.one"}, {"QVMenuItem", "One"}})};
  system.files.addPropertyList(restrictionsPath, dictionary({{"QVUnrestricted", row}}));
  update(KELStaleAppRegistryPaths);
  EXPECT_TRUE(isRestricted());
  update(KELStaleRestrictionLists);
  EXPECT_FALSE(isRestricted());
  system.files.removeTree(restrictionsPath);
  update(KELStaleRestrictionLists);
  EXPECT_FALSE(isRestricted()) << "a missing file took the lists away";
}

}  // namespace
}  // namespace kel::test
