#include "entries/app_entry.h"

#include "entries/entry_fixture.h"

namespace kel::test {
namespace {

using platform::PropertyListDictionary;
using platform::PropertyListDictionaryBuilder;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::SizeIs;

class AppEntryTest : public EntryTest {
 protected:
  AppEntryTest() { addBundle(system.files, path, information); }

  PropertyListDictionary menuStrings() const {
    const KELAppEntry::Value value = entry->localizationToMenuStrings();
    return value ? *value->asDictionary() : PropertyListDictionary();
  }

  const PropertyListDictionary information =
      dictionary({{"KTBundleIdentifier", "org.demo"},
                  {"KTBundleName", "Demo"},
                  {"KTBundleVersion", "1.0"},
                  {"QVServices", Array{dictionary({{"QVMessage", "go"}, {"Icon", "x"}})}}});
  const PropertyListDictionary german = dictionary({{"Open", "Öffnen"}});
  const PropertyListDictionary english = dictionary({{"Open", "Open It"}});
  const std::shared_ptr<KELAppEntry> entry = entryAt(path);
};

TEST_F(AppEntryTest, RefreshReadsTheFourValuesOnceAndBecomesValid) {
  EXPECT_EQ(debugLines([&] { entry->refreshCache(); }), "Loading Services from path " + path);
  EXPECT_TRUE(entry->servicesCacheIsValid());
  EXPECT_EQ(entry->cacheRepresentation(), dictionary({{"bundle_id", "org.demo"},
                                                      {"name", "Demo"},
                                                      {"vers", "1.0"},
                                                      {"service_dicts", *information.find("QVServices")}}));
  EXPECT_EQ(debugLines([&] { entry->refreshCache(); }), "") << "a valid entry is not loaded";
  EXPECT_EQ(system.bundles.opens(path), 1u);
}

TEST_F(AppEntryTest, BundleThatCannotBeOpenedLeavesTheEntryInvalid) {
  const auto missing = entryAt("/Applications/Missing.app");
  EXPECT_EQ(debugLines([&] { missing->refreshCache(); }),
            "Unable to create a bundle for path /Applications/Missing.app, skipping it");
  EXPECT_FALSE(missing->servicesCacheIsValid());
  EXPECT_FALSE(missing->loadFromBundle(nullptr));
  EXPECT_EQ(missing->cacheRepresentation(), PropertyListDictionary());
}

TEST_F(AppEntryTest, MalformedBundleIsReportedAndKeptButNotValid) {
  addBundle(system.files, path, dictionary({{"KTBundleName", 7}}));
  entry->refreshCache();
  EXPECT_FALSE(entry->servicesCacheIsValid());
  EXPECT_EQ(entry->cacheRepresentation(), dictionary({{"name", 7}}));
  EXPECT_THAT(system.log.take(), SizeIs(1));

  addBundle(system.files, path, information);
  entry->refreshCache();
  EXPECT_TRUE(entry->servicesCacheIsValid());
  EXPECT_THAT(system.log.messages(), IsEmpty());
}

TEST_F(AppEntryTest, BundleWithoutInformationIsValidAndOffersNothing) {
  system.files.addDirectory("/Applications/Bare.app");
  const auto bare = entryAt("/Applications/Bare.app");
  bare->refreshCache();
  std::vector<PropertyListDictionaryBuilder> services;
  bare->addPublicDictionariesForServices(services);
  EXPECT_TRUE(bare->servicesCacheIsValid());
  EXPECT_THAT(services, IsEmpty());
}

TEST_F(AppEntryTest, CacheRepresentationGivesTheSameEntryBackWhateverItHolds) {
  const auto representation = dictionary({{"bundle_id", 7},
                                          {"name", "Demo"},
                                          {"service_dicts", "no array"},
                                          {"loc_to_menu_strings", dictionary({{"German", false}})}});
  const auto restored = KELAppEntry::initFromCacheRepresentation(system.platform, representation, path);
  EXPECT_EQ(restored->cacheRepresentation(), representation);
  EXPECT_FALSE(restored->servicesCacheIsValid());
  EXPECT_EQ(restored->app_id(), entry->app_id());
  EXPECT_NE(entryAt("/Applications/démo.app")->app_id(), entry->app_id());
  EXPECT_EQ(KELAppEntry::initFromCacheRepresentation(system.platform, Array{}, path), nullptr);
  EXPECT_EQ(KELAppEntry::initFromCacheRepresentation(system.platform, std::nullopt, path), nullptr);
}

TEST_F(AppEntryTest, MenuStringsSurviveARefreshUnlessOneOfTheFourValuesChanged) {
  const std::vector<std::pair<PropertyListDictionary::Entry, bool>> changes{
      {{"Icon", "new"}, true},
      {{"KTBundleIdentifier", "org.new"}, false},
      {{"KTBundleName", "New"}, false},
      {{"KTBundleVersion", "1.1"}, false},
      {{"QVServices", Array{dictionary({{"QVMessage", "new"}})}}, false}};
  for (const auto& [change, kept] : changes) {
    addBundle(system.files, path, information);
    entry->setServicesCacheIsValid(false);
    entry->refreshCache();
    entry->setLocalizationToMenuStrings(dictionary({{"German", german}}));

    PropertyListDictionaryBuilder changed(information);
    changed.set(change.first, change.second);
    addBundle(system.files, path, changed.build());
    entry->setServicesCacheIsValid(false);
    entry->refreshCache();
    EXPECT_EQ(entry->localizationToMenuStrings().has_value(), kept) << change.first.text();
  }
}

TEST_F(AppEntryTest, LocalizationWalkStopsAtTheFirstUsableFileAndRemembersTheMisses) {
  addMenuStrings(system.files, path, "German", german);
  addMenuStrings(system.files, path, "English", english);
  EXPECT_EQ(debugLines([&] {
              entry->loadLocalizations({});
              entry->loadLocalizations({"French", "German", "English"});
            }),
            "No entry for localization French in app " + path + "\nRead localization German in app " + path);
  EXPECT_EQ(menuStrings(), dictionary({{"French", false}, {"German", german}}));
  EXPECT_EQ(system.bundles.opens(path), 1u);

  system.files.resetCounts();
  entry->loadLocalizations({"French", "German", "English"});
  EXPECT_EQ(system.bundles.opens(path), 1u) << "everything on the way is known";
  entry->loadLocalizations({"French", "English"});
  EXPECT_EQ(menuStrings(), dictionary({{"English", english}, {"French", false}, {"German", german}}));
  EXPECT_EQ(system.files.counts(path + "/Resources/French/ServicesMenu.strings"), FileOperationCounts{});
}

TEST_F(AppEntryTest, UnusableStringsFilesCountAsMissing) {
  const std::string file = path + "/Resources/German/ServicesMenu.strings";
  addMenuStrings(system.files, path, "German", Array{});
  system.files.addText(path + "/Secret/ServicesMenu.strings", "\"a\" = \"b\";");
  EXPECT_EQ(debugLines([&] {
              entry->loadLocalizations({"German", "../Secret"});
            }),
            "Unable to read strings file " + file + "\nNo entry for localization German in app " + path +
                "\nNo entry for localization ../Secret in app " + path);
  EXPECT_EQ(menuStrings(), dictionary({{"German", false}, {"../Secret", false}}));
}

TEST_F(AppEntryTest, StringsFormIsReadAndAVanishedBundleChangesNothing) {
  system.files.addText(path + "/Resources/German/ServicesMenu.strings",
                       "/* menu */ \"Open\" = \"Öffnen\";\n");
  entry->loadLocalizations({"German"});
  EXPECT_EQ(menuStrings(), dictionary({{"German", german}}));

  system.files.removeTree(path);
  EXPECT_EQ(debugLines([&] { entry->loadLocalizations({"French"}); }), "");
  EXPECT_EQ(menuStrings(), dictionary({{"German", german}}));
}

TEST_F(AppEntryTest, CachedMenuStringsThatAreNoDictionaryAreReplacedByTheNextLookup) {
  entry->setLocalizationToMenuStrings("damaged");
  entry->loadLocalizations({"French"});
  EXPECT_EQ(menuStrings(), dictionary({{"French", false}}));
}

}  // namespace
}  // namespace kel::test
