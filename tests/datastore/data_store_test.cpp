#include "datastore/data_store.h"

#include <gmock/gmock.h>
#include <regex>

#include "support/debug_lines.h"
#include "support/in_memory_platform.h"
#include "support/print.h"

namespace kel {
namespace {

using platform::PropertyListArray;
using platform::PropertyListDictionary;
using platform::PropertyListDictionaryBuilder;
using platform::PropertyListValue;
using test::InMemoryPlatform;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::Not;
using testing::UnorderedElementsAre;
using Paths = std::vector<std::string>;

constexpr const char* cachePath = "/home/u/.cache/com.orvex.qvservicescache.plist";
constexpr const char* services = "/home/u/Library/Services/";

PropertyListDictionary dictionary(std::vector<PropertyListDictionary::Entry> entries) {
  return PropertyListDictionary(std::move(entries));
}

PropertyListDictionary service(const std::string& title) {
  return dictionary({{"QVMenuItem", dictionary({{"default", title}})}, {"QVMessage", "go"}});
}

/// An information dictionary with one service of this title.
PropertyListDictionary information(const std::string& identifier, const std::string& title) {
  return dictionary({{"KTBundleIdentifier", identifier}, {"QVServices", PropertyListArray{service(title)}}});
}

class DataStoreTest : public testing::Test {
 protected:
  void SetUp() override {
    addBundle(system.files, services + std::string("one.service"), information("org.a.one", "One"));
    addBundle(system.files, services + std::string("two.service"), information("org.a.two", "Two"));
    addBundle(system.files, "/Applications/App.app", information("org.a.app", "App"));
    system.registry.add("/Applications/App.app");
    system.files.addPropertyList("/System/Library/CoreAgents/com.orvex.QVServicesRestrictions.plist",
                                 dictionary({}));
  }

  static std::unique_ptr<KELDataStore> makeStore(InMemoryPlatform& system) {
    return KELDataStore::initWithSystemServices(system.platform);
  }

  /// The default titles of the public list, in its order.
  static Paths titles(KELDataStore& store) {
    Paths result;
    for (const PropertyListValue& entry : *store.currentPublicDictionaries().asArray()) {
      const auto* menuItem = entry.asDictionary()->find("QVMenuItem")->asDictionary();
      result.push_back(*menuItem->find("default")->asString());
    }
    return result;
  }

  /// An update's debug lines, entry addresses replaced.
  static std::string update(KELDataStore& store, KELStaleCacheFlags flags) {
    const std::string lines = test::debugLines([&] { store.updateServicesCache(flags); });
    return std::regex_replace(lines, std::regex("<KELAppEntry: [^>]*>"), "<entry>");
  }

  PropertyListDictionary cacheFile() {
    const auto reading = platform::readPropertyList(system.files.contents(cachePath).value());
    return *reading.value->asDictionary();
  }

  void writeCacheFile(const PropertyListDictionary& cache) { system.files.addPropertyList(cachePath, cache); }

  std::size_t readsOfInformation(const std::string& bundle) {
    return system.files.counts(bundle + "/Info.plist").reads;
  }

  InMemoryPlatform system;
  std::unique_ptr<KELDataStore> store = makeStore(system);
};

TEST_F(DataStoreTest, TheFirstUpdateReadsEverySourceAndSaysSo) {
  const std::string lines = update(*store, 0);
  EXPECT_THAT(lines, HasSubstr("Loading cache from " + std::string(cachePath) + "\nCache at " + cachePath +
                               " came back nil (file does NOT exist)\nCache contains 0 keys\n"
                               "0 path(s) from AppRegistry"));
  EXPECT_THAT(lines, HasSubstr("Service providing paths:\n\t/Applications/App.app"));
  EXPECT_THAT(lines, HasSubstr(std::string("Scanning directory: ") + services));
  EXPECT_THAT(lines, HasSubstr("Creating entry <entry> for path /Applications/App.app"));
  EXPECT_THAT(titles(*store), ElementsAre("App", "One", "Two"));
}

TEST_F(DataStoreTest, ARestartFromTheCacheListsNoDirectoryOpensNoBundleAndGivesTheSameList) {
  update(*store, KELStaleEverything);
  const PropertyListValue list = store->currentPublicDictionaries();
  store->writeCaches();
  store.reset();
  system.files.resetCounts();
  const std::size_t opens = system.bundles.opens();

  const auto restarted = makeStore(system);
  EXPECT_TRUE(restarted->cacheIsFromThisBootSession());
  EXPECT_EQ(restarted->currentPublicDictionaries(), list);
  EXPECT_THAT(update(*restarted, KELStaleServiceDirectories),
              HasSubstr(std::string("No changes!\nCache valid for directory ")));
  EXPECT_EQ(restarted->currentPublicDictionaries(), list);
  EXPECT_EQ(system.bundles.opens(), opens);
  EXPECT_EQ(system.files.counts(services).listings, 0U);
}

TEST_F(DataStoreTest, TheCacheFileHoldsExactlyItsKeys) {
  update(*store, KELStaleEverything);
  EXPECT_THAT(test::debugLines([&] {
                store->writeCaches();
                store.reset();
              }),
              testing::MatchesRegex("Wrote out cache file \\([0-9]+ bytes\\)"));
  const PropertyListDictionary cache = cacheFile();
  std::vector<std::string> keys;
  for (const auto& [key, value] : cache) keys.push_back(key.text());
  EXPECT_THAT(keys, ElementsAre("QVServicesARPaths", "QVServicesBuildVersion",
                                "QVServicesExplicitDirectoryCache", "QVServicesLastEventID",
                                "QVServicesRestrictionLists", "QVServicesSessionID", "ServicesCache"));
  EXPECT_EQ(*cache.find("QVServicesSessionID"), "1700000000,100004");
  EXPECT_EQ(*cache.find("QVServicesLastEventID"), 1000);
  EXPECT_EQ(*cache.find("QVServicesARPaths"), (PropertyListArray{"/Applications/App.app"}));
  EXPECT_EQ(cache.find("ServicesCache")->asDictionary()->size(), 3U);
  EXPECT_EQ(system.transactions.openCount(), 0);

  const auto fresh = makeStore(system);
  system.files.removeTree("/System/Library/CoreAgents");
  fresh->writeCaches();
  fresh->flushCaches();
  EXPECT_FALSE(system.files.isFile(cachePath)) << "a deletion overtook the write queued before it";
}

TEST_F(DataStoreTest, ADamagedOrForeignCacheIsLeftOutAsFarAsItIsWrong) {
  const PropertyListValue version = "linux 1";
  const PropertyListValue goodEntry = dictionary({{"bundle_id", "org.cached"}});
  struct Case {
    const char* name;
    PropertyListDictionary cache;
    const char* expected;
  };
  for (const Case& c : {
           Case{"other version",
                dictionary({{"QVServicesBuildVersion", "linux 2"}, {"QVServicesLastEventID", 5}}),
                "Ignoring cache because it has the wrong version\nCache contains 0 keys\n0 path(s)"},
           Case{"version of another kind", dictionary({{"QVServicesBuildVersion", 1}}),
                "Ignoring cache because it has the wrong version"},
           Case{"event ID as a string",
                dictionary({{"QVServicesBuildVersion", version}, {"QVServicesLastEventID", "5"}}),
                "Cache read OK\nCache contains 2 keys\n0 path(s) from AppRegistry"},
           Case{"event ID as a number",
                dictionary({{"QVServicesBuildVersion", version}, {"QVServicesLastEventID", 5}}),
                "Cache contains 2 keys\nEventStreamID was 5\n0 path(s) from AppRegistry"},
           Case{"entries that are no dictionaries",
                dictionary({{"QVServicesBuildVersion", version},
                            {"ServicesCache", dictionary({{"/x", "text"}, {"/y", goodEntry}})}}),
                "0 path(s) from AppRegistry\nLoaded cached entry <entry> for path /y"},
           Case{"sources of other kinds",
                dictionary({{"QVServicesBuildVersion", version},
                            {"QVServicesARPaths", "text"},
                            {"QVServicesRestrictionLists", 1},
                            {"QVServicesExplicitDirectoryCache", dictionary({{services, "text"}})},
                            {"ServicesCache", PropertyListArray{}}}),
                "Cache contains 5 keys\n0 path(s) from AppRegistry"},
       }) {
    writeCacheFile(c.cache);
    const auto own = makeStore(system);
    const std::string lines = std::regex_replace(test::debugLines([&] { own->loadCache(); }),
                                                 std::regex("<KELAppEntry: [^>]*>"), "<entry>");
    EXPECT_THAT(lines, HasSubstr(c.expected)) << c.name;
    EXPECT_FALSE(own->cacheIsFromThisBootSession()) << c.name;
    EXPECT_THAT(titles(*own), IsEmpty()) << c.name;
  }
  system.files.addText(cachePath, "bplist00 but no more");
  EXPECT_THAT(test::debugLines([&] { makeStore(system)->loadCache(); }),
              HasSubstr("came back nil (file does exist)"));
}

TEST_F(DataStoreTest, TheBootSessionIsKeptForTheProcessAndComparedWithTheCache) {
  update(*store, KELStaleEverything);
  store->writeCaches();
  store.reset();
  const auto sameSystemLater = [&](auto change) {
    InMemoryPlatform later;
    later.files.addFile(cachePath, system.files.contents(cachePath).value());
    change(later.facts);
    return makeStore(later)->cacheIsFromThisBootSession();
  };
  EXPECT_TRUE(sameSystemLater([](auto&) {}));
  EXPECT_FALSE(sameSystemLater([](test::InMemoryFacts& facts) { facts.boot.value = 1700000001; }));
  EXPECT_FALSE(sameSystemLater([](test::InMemoryFacts& facts) { facts.session.value = -1; }));

  InMemoryPlatform broken;
  broken.facts.boot = {std::nullopt, 2, "No such file or directory"};
  broken.facts.session = {std::nullopt, 1, "Operation not permitted"};
  std::string identity;
  EXPECT_EQ(test::debugLines([&] { identity = boot_session_id(broken.platform); }),
            "sysctlbyname(\"kern.boottime\") failed with errno 2 (No such file or directory)\n"
            "getaudit_addr() failed with errno 1 (Operation not permitted)");
  EXPECT_EQ(identity, "0,0");
  broken.facts.boot = {5, 0, {}};
  EXPECT_EQ(test::debugLines([&] { identity = boot_session_id(broken.platform); }), "");
  EXPECT_EQ(identity, "0,0");
}

TEST_F(DataStoreTest, AFailedWriteKeepsTheOldFileAndIsTold) {
  update(*store, KELStaleEverything);
  store->writeCaches();
  store.reset();
  system.files.failNextWrite("Disk full");
  const std::string lines = test::debugLines([&] { makeStore(system)->writeCaches(); });
  EXPECT_EQ(lines, "Failed to write cache file: Disk full");
  EXPECT_EQ(cacheFile().find("ServicesCache")->asDictionary()->size(), 3U);
}

TEST_F(DataStoreTest, AFlushForgetsTheListsButNotTheRegistryOrThePosition) {
  update(*store, KELStaleEverything);
  store->writeCaches();
  store->flushCaches();
  EXPECT_FALSE(system.files.isFile(cachePath));
  EXPECT_THAT(titles(*store), IsEmpty());
  const std::size_t queries = system.registry.queries;
  const std::string lines = update(*store, 0);
  EXPECT_EQ(system.registry.queries, queries);
  EXPECT_THAT(lines, HasSubstr(std::string("Scanning directory: ") + services));
  EXPECT_THAT(titles(*store), ElementsAre("App", "One", "Two"));
}

TEST_F(DataStoreTest, FlagsSayWhichSourcesAreReadAgain) {
  update(*store, KELStaleEverything);
  system.files.resetCounts();
  const std::size_t queries = system.registry.queries;
  addBundle(system.files, "/Applications/New.app", information("org.a.new", "New"));
  system.registry.add("/Applications/New.app");
  addBundle(system.files, services + std::string("three.service"), information("org.a.three", "Three"));
  system.journal.record(services + std::string("three.service/Info.plist"));

  update(*store, 0);
  EXPECT_THAT(titles(*store), ElementsAre("App", "One", "Two"));
  EXPECT_EQ(system.registry.queries, queries);
  EXPECT_TRUE(system.journal.creations.empty());
  update(*store, 8 | 16);
  EXPECT_EQ(system.registry.queries, queries);
  update(*store, KELStaleAppRegistryPaths);
  EXPECT_THAT(titles(*store), ElementsAre("App", "New", "One", "Two"));
  EXPECT_EQ(system.files.counts(services).listings, 0U);
  update(*store, KELStaleServiceDirectories);
  EXPECT_THAT(titles(*store), ElementsAre("App", "New", "One", "Three", "Two"));
  EXPECT_EQ(readsOfInformation(services + std::string("one.service")), 0U);
}

TEST_F(DataStoreTest, AChangeInsideAKnownBundleReloadsThatBundleAndListsNothing) {
  update(*store, KELStaleEverything);
  system.files.resetCounts();
  addBundle(system.files, services + std::string("two.service"), information("org.a.two", "Changed"));
  system.journal.record(services + std::string("two.service/Info.plist"));
  update(*store, KELStaleServiceDirectories);
  EXPECT_THAT(titles(*store), ElementsAre("App", "One", "Changed"));
  EXPECT_EQ(readsOfInformation(services + std::string("two.service")), 1U);
  EXPECT_EQ(readsOfInformation(services + std::string("one.service")), 0U);
  EXPECT_EQ(system.files.counts(services).listings, 0U);
}

TEST_F(DataStoreTest, TheNextUpdateResumesWhereThisOneBegan) {
  update(*store, KELStaleEverything);
  system.journal.record("/elsewhere");
  update(*store, KELStaleServiceDirectories);
  ASSERT_FALSE(system.journal.creations.empty());
  EXPECT_EQ(system.journal.creations.back().since, 1000U);
  update(*store, KELStaleServiceDirectories);
  EXPECT_EQ(system.journal.creations.back().since, 1001U);
}

TEST_F(DataStoreTest, WithoutAUsableJournalEverythingIsReadAgain) {
  update(*store, KELStaleEverything);
  system.files.resetCounts();
  system.journal.available = false;
  EXPECT_THAT(update(*store, KELStaleServiceDirectories), HasSubstr("VigilStream failed!"));
  EXPECT_EQ(system.files.counts(services).listings, 1U);
  EXPECT_EQ(readsOfInformation("/Applications/App.app"), 1U);
}

TEST_F(DataStoreTest, BundlesThatVanishOrStopLoadingDropOutAndAreTriedAgain) {
  update(*store, KELStaleEverything);
  const std::string one = services + std::string("one.service");
  addBundle(system.files, one, dictionary({{"KTBundleName", 5}}));
  system.files.removeTree(services + std::string("two.service"));
  system.journal.record(one + "/Info.plist");
  system.journal.record(services + std::string("two.service"));
  system.journal.record(services + std::string("."));
  update(*store, KELStaleServiceDirectories);
  EXPECT_THAT(titles(*store), ElementsAre("App"));
  EXPECT_THAT(system.log.take(),
              ElementsAre(HasSubstr("Malformed Services entries in Info.plist for Service at "
                                    "URL " +
                                    one)));
  addBundle(system.files, one, information("org.a.one", "Mended"));
  EXPECT_THAT(update(*store, 0), HasSubstr("Creating entry <entry> for path " + one));
  EXPECT_THAT(titles(*store), ElementsAre("App", "Mended"));
}

TEST_F(DataStoreTest, FilesInsideAnArchiveNeverGetAnEntry) {
  addBundle(system.files, "/B/Old.tqarchive/X.app", information("org.a.x", "X"));
  system.registry.add("/B/Old.tqarchive/X.app");
  for (int round = 0; round < 2; ++round) {
    EXPECT_THAT(update(*store, KELStaleEverything),
                HasSubstr("Skipping file inside .tqarchive: /B/Old.tqarchive/X.app"));
  }
  EXPECT_THAT(titles(*store), ElementsAre("App", "One", "Two"));
}

TEST_F(DataStoreTest, CopiesAreDecidedAndEntriesWithoutIdentifierSortAsNull) {
  addBundle(system.files, "/Applications/Copy of One.app", information("org.a.one", "Loser"));
  system.registry.add("/Applications/Copy of One.app");
  for (const std::string identifier : {"!first", "0digit"}) {
    addBundle(system.files, services + identifier + ".service", information(identifier, identifier));
  }
  addBundle(system.files, services + std::string("nameless.service"),
            dictionary({{"QVServices", PropertyListArray{service("Nameless")}}}));
  addBundle(system.files, services + std::string("zz.service"),
            dictionary({{"QVServices", PropertyListArray{service("Also nameless")}}}));
  const std::string lines = test::debugLines([&] {
    store->updateServicesCache(KELStaleEverything);
    store->currentPublicDictionaries();
  });
  EXPECT_THAT(lines, HasSubstr(std::string("Collision resolution: preferring ") + services +
                               "one.service to /Applications/Copy of One.app due to directory precedence"));
  EXPECT_THAT(titles(*store),
              ElementsAre("!first", "Nameless", "Also nameless", "0digit", "App", "One", "Two"));
}

TEST_F(DataStoreTest, SpellCheckersSurviveOnlyWhereTheyMayLive) {
  const auto spellChecker = [](const std::string& title) {
    PropertyListDictionaryBuilder declared(service(title));
    declared.set("QVSpellChecker", "checker");
    return PropertyListArray{declared.build(), service(title + " plain")};
  };
  for (const auto& [path, title] : std::vector<std::pair<std::string, std::string>>{
           {"/home/u/Library/Services/s.service", "user"},
           {"/OrvexInternal/Library/Services/s.service", "internal"},
           {"/home/u/Library/Services2/s.app", "sibling"},
           {"/Applications/s.app", "application"}}) {
    addBundle(system.files, path,
              dictionary({{"KTBundleIdentifier", title}, {"QVServices", spellChecker(title)}}));
    if (path.ends_with(".app")) system.registry.add(path);
  }
  update(*store, KELStaleEverything);
  EXPECT_THAT(titles(*store), ElementsAre("application plain", "internal plain", "App", "One", "Two",
                                          "sibling", "sibling plain", "user", "user plain"));
}

TEST_F(DataStoreTest, LocalizationsReachTheListAndTheCache) {
  addMenuStrings(system.files, services + std::string("one.service"), "German",
                 dictionary({{"One", "Eins"}}));
  update(*store, KELStaleEverything);
  EXPECT_EQ(test::debugLines([&] { store->fetchLocalizations(std::nullopt); }), "");
  EXPECT_THAT(test::debugLines([&] {
                store->fetchLocalizations({{"French", "German"}});
              }),
              testing::StartsWith("Fetching localization(s): French, German"));
  const auto germanTitle = [](KELDataStore& from) {
    for (const PropertyListValue& entry : *from.currentPublicDictionaries().asArray()) {
      if (const auto* title = entry.asDictionary()->find("QVMenuItem")->asDictionary()->find("German"))
        return *title;
    }
    return PropertyListValue("none");
  };
  EXPECT_EQ(germanTitle(*store), "Eins");
  store->writeCaches();
  store.reset();
  EXPECT_EQ(germanTitle(*makeStore(system)), "Eins");
}

TEST_F(DataStoreTest, RestrictionsAreReadAgainOnlyWhenTold) {
  addBundle(system.files, services + std::string("one.service"), information("com.orvex.one", "One"));
  const auto restricted = [&] {
    const auto& list = *store->currentPublicDictionaries().asArray();
    return std::count_if(list.begin(), list.end(), [](const auto& entry) {
      return entry.asDictionary()->find("QVRestricted") != nullptr;
    });
  };
  update(*store, KELStaleEverything);
  EXPECT_EQ(restricted(), 1);
  const PropertyListArray row{dictionary({{"QVBundleID", "com.orvex.one"}, {"QVMenuItem", "One"}})};
  system.files.addPropertyList("/System/Library/CoreAgents/com.orvex.QVServicesRestrictions.plist",
                               dictionary({{"QVUnrestricted", row}}));
  update(*store, KELStaleAppRegistryPaths);
  EXPECT_EQ(restricted(), 1);
  update(*store, KELStaleRestrictionLists);
  EXPECT_EQ(restricted(), 0);
  system.files.removeTree("/System/Library/CoreAgents");
  update(*store, KELStaleRestrictionLists);
  EXPECT_EQ(restricted(), 0) << "a missing file took the lists away";
}

TEST(PathsToObserveTest, ThreeNeighboursAreWatchedThroughTheirDirectoryAndNothingTwice) {
  struct Case {
    Paths paths;
    Paths expected;
  };
  for (const Case& c : {Case{{}, {}}, Case{{"/A/x.app", "/A/y.app"}, {"/A/x.app", "/A/y.app"}},
                        Case{{"/A/x.app", "/A/y.app", "/A/z.app"}, {"/A/"}},
                        Case{{"/A/x.app", "/A/y.app", "/A/z.app", "/A/B/w.app"}, {"/A/"}},
                        Case{{"/x", "/y", "/z", "/A/w.app"}, {"/"}},
                        Case{{"/A/x.app", "/A/x.app/in.app"}, {"/A/x.app", "/A/x.app/in.app"}}}) {
    EXPECT_THAT(paths_to_observe(c.paths), testing::UnorderedElementsAreArray(c.expected));
  }
}

TEST(ParentDirectoryTest, EndsInASlashAndStopsAtTheRoot) {
  for (const auto& [path, parent] : std::vector<std::pair<std::string, std::string>>{
           {"/A/x.app", "/A/"}, {"/A/", "/"}, {"/A/B/", "/A/"}, {"/", "/"}, {"x", "/"}, {"", "/"}}) {
    EXPECT_EQ(parent_directory(path), parent) << path;
  }
}

}  // namespace
}  // namespace kel
