#include "entries/app_entry.h"

#include <limits>

#include "support/debug_lines.h"
#include "support/in_memory_platform.h"
#include "support/property_lists.h"

namespace kel::test {
namespace {

using platform::Bytes;

/// A platform, one bundle and its entry.
struct AppEntryTest : testing::Test {
  AppEntryTest() { addBundle(system.files, path, information); }

  std::shared_ptr<KELAppEntry> entryAt(const std::string& bundlePath) {
    return KELAppEntry::initWithBundlePath(system.platform, bundlePath);
  }

  /// An entry as the cache file would give it back: nothing of it is tested.
  std::shared_ptr<KELAppEntry> cached(Entries fields) {
    return KELAppEntry::initFromCacheRepresentation(system.platform, dictionary(std::move(fields)), path);
  }

  static std::vector<Dictionary> publicServices(const KELAppEntry& entry) {
    std::vector<DictionaryBuilder> services;
    entry.addPublicDictionariesForServices(services);
    std::vector<Dictionary> result;
    for (const DictionaryBuilder& service : services) result.push_back(service.build());
    return result;
  }

  /// Replaces the bundle, refreshes the entry and tells the debug lines.
  std::string refresh(const Dictionary& replaced) {
    addBundle(system.files, path, replaced);
    entry->setServicesCacheIsValid(false);
    return debugLines([this] { entry->refreshCache(); });
  }

  /// Loads localizations and tells the debug lines.
  std::string load(const Names& localizations) {
    return debugLines([&] { entry->loadLocalizations(localizations); });
  }

  InMemoryPlatform system;
  const std::string path = "/Applications/Démo.app";
  const Dictionary information =
      dictionary({{"KTBundleIdentifier", "org.demo"},
                  {"KTBundleName", "Demo"},
                  {"KTBundleVersion", "1.0"},
                  {"QVServices", Array{dictionary({{"QVMessage", "go"}, {"Icon", "x"}})}}});
  const Dictionary german = dictionary({{"Open", "Öffnen"}});
  const std::shared_ptr<KELAppEntry> entry = entryAt(path);
};

TEST_F(AppEntryTest, RefreshReadsTheFourValuesUntilTheyAreWellFormed) {
  refresh(dictionary({{"KTBundleName", 7}}));
  EXPECT_FALSE(entry->servicesCacheIsValid());
  EXPECT_EQ(entry->cacheRepresentation(), dictionary({{"name", 7}})) << "malformed values are kept";
  EXPECT_THAT(system.log.take(), SizeIs(1));
  EXPECT_EQ(refresh(information), "Loading Services from path " + path);
  EXPECT_TRUE(entry->servicesCacheIsValid());
  EXPECT_EQ(entry->cacheRepresentation(), dictionary({{"bundle_id", "org.demo"},
                                                      {"name", "Demo"},
                                                      {"vers", "1.0"},
                                                      {"service_dicts", *information.find("QVServices")}}));
  EXPECT_EQ(debugLines([&] { entry->refreshCache(); }), "") << "a valid entry is not loaded";
  const auto missing = entryAt("/Missing.app");
  EXPECT_EQ(debugLines([&] { missing->refreshCache(); }),
            "Unable to create a bundle for path /Missing.app, skipping it");
  EXPECT_FALSE(missing->servicesCacheIsValid() || missing->loadFromBundle(nullptr));
  EXPECT_THAT(system.log.take(), IsEmpty());
}

TEST_F(AppEntryTest, CacheRepresentationGivesTheSameEntryBackWhateverItHolds) {
  const Entries fields{{"bundle_id", 7}, {"service_dicts", "x"}, {"loc_to_menu_strings", dictionary({})}};
  EXPECT_EQ(cached(fields)->cacheRepresentation(), dictionary(fields));
  EXPECT_FALSE(cached(fields)->servicesCacheIsValid());
  EXPECT_EQ(KELAppEntry::initFromCacheRepresentation(system.platform, Array{}, path), nullptr);
  EXPECT_EQ(KELAppEntry::initFromCacheRepresentation(system.platform, std::nullopt, path), nullptr);
}

TEST_F(AppEntryTest, MenuStringsSurviveARefreshUnlessOneOfTheFourValuesChanged) {
  for (const char* key : {"Icon", "KTBundleIdentifier", "KTBundleName", "KTBundleVersion", "QVServices"}) {
    refresh(information);
    entry->setLocalizationToMenuStrings(dictionary({{"German", german}}));
    DictionaryBuilder changed(information);
    changed.set(key, "new");
    refresh(changed.build());
    EXPECT_EQ(entry->localizationToMenuStrings().has_value(), key == std::string("Icon")) << key;
  }
}

TEST_F(AppEntryTest, LocalizationWalkStopsAtTheFirstUsableFileAndRemembersTheMisses) {
  const std::string files = path + "/Resources/";
  system.files.addText(files + "German/ServicesMenu.strings", "/* menu */ \"Open\" = \"Öffnen\";\n");
  addMenuStrings(system.files, path, "English", german);
  addMenuStrings(system.files, path, "Dutch", Array{});
  system.files.addText(path + "/Secret/ServicesMenu.strings", "\"a\" = \"b\";");
  const auto none = [this](const std::string& name) {
    return "No entry for localization " + name + " in app " + path;
  };
  entry->setLocalizationToMenuStrings("damaged");
  EXPECT_EQ(load({}), "");
  system.files.setFailing({files + "German/ServicesMenu.strings"});
  for (int attempt = 0; attempt < 2; ++attempt) load({"German", "English"});
  EXPECT_TRUE(entry->isUnsettled() && entry->localizationToMenuStrings() == Value("damaged"));
  EXPECT_THAT(system.log.take(), SizeIs(1)) << "what may pass is told once, and is no answer";
  load({});
  EXPECT_FALSE(entry->isUnsettled()) << "what nobody asks for any more is looked for";
  system.bundles.opens = 0;
  system.files.setFailing({});
  EXPECT_EQ(load({"French", "German", "English"}),
            none("French") + "\nRead localization German in app " + path);
  EXPECT_EQ(entry->localizationToMenuStrings(), Value(dictionary({{"French", false}, {"German", german}})));
  EXPECT_EQ(load({"French", "German", "English"}), "");
  EXPECT_EQ(system.bundles.opens, 1) << "everything on the way was known";
  EXPECT_EQ(load({"French", "Dutch", "../Secret", "English"}),
            "Unable to read strings file " + files + "Dutch/ServicesMenu.strings\n" + none("Dutch") + "\n" +
                none("../Secret") + "\nRead localization English in app " + path);
  const KELAppEntry::Value all = dictionary(
      {{"../Secret", false}, {"Dutch", false}, {"English", german}, {"French", false}, {"German", german}});
  EXPECT_EQ(entry->localizationToMenuStrings(), all);
  EXPECT_EQ(system.files.uses(files + "French/ServicesMenu.strings"), 1U);
  system.files.removeTree(path);
  EXPECT_EQ(load({"Greek"}), "") << "a bundle that vanished";
  EXPECT_EQ(entry->localizationToMenuStrings(), all);
}

TEST_F(AppEntryTest, DirectoryThenBootVolumeThenPathLengthDecideBetweenCopies) {
  EXPECT_THAT(service_directory_precedence(system.platform),
              ElementsAre("/System/Library/Services/", "/Library/Services/", "/home/u/Library/Services/",
                          "/Applications/", "/OrvexInternal/Library/Services/",
                          "/OrvexInternal/Applications/", "/Network/Library/Services/"));
  const auto wins = [this](const std::string& first, const std::string& second) {
    return entryAt(first)->shouldTakePriorityOverEntry(*entryAt(second));
  };
  using Row = std::tuple<std::string, std::string, std::string>;
  for (const auto& [first, second, reason] : {
           Row{"/System/Library/Services/A long name.service", "/Applications/A.app", "directory precedence"},
           Row{"/Network/Library/Services/A.service", "/x/A.app", "directory precedence"},
           Row{"/Applications/A.app", "/applications/A.app", "directory precedence"},
           Row{"/home/u/Desktop/Folder/A.app", "/Volumes/D/A.app", "boot volume"},
           Row{"/Volumes.old/A.app", "/Volumes/A.app", "boot volume"},
           Row{"/Volumes/D/A.app", "/Volumes/D/Old/A.app", "path length"},
           Row{"/x/\u20ac\u20ac.app", "/x/\U0001F600a.app", "path length"},
       }) {
    EXPECT_EQ(debugLines([&, &one = first, &other = second] { EXPECT_TRUE(wins(one, other)); }),
              "Collision resolution: preferring " + first + " to " + second + " due to " + reason);
    EXPECT_FALSE(wins(second, first)) << second << " over " << first;
  }
  EXPECT_TRUE(wins("/x/\U0001F600.app", "/x/ab.app") && wins("/x/ab.app", "/x/\U0001F600.app"));
}

struct NormalisationTest : AppEntryTest {
  /// The public form without what every service has.
  Dictionary rest(Entries declared, Value tables = Dictionary()) {
    const auto services = publicServices(*cached({{"service_dicts", Array{dictionary(std::move(declared))}},
                                                  {"loc_to_menu_strings", std::move(tables)}}));
    Entries left;
    for (const auto& [key, value] : services.at(0)) {
      if (key.text() != "QVBundlePath" && key.text() != "QVUUID" && value != Value(Dictionary()))
        left.emplace_back(key, value);
    }
    return dictionary(std::move(left));
  }
};

TEST_F(NormalisationTest, EveryServiceHasPathIdentifierTitlesAndAnIdentityOfItsPathAndPlace) {
  const Dictionary bare = dictionary({{"Icon", "x"}});
  const auto services =
      publicServices(*cached({{"bundle_id", "org.demo"}, {"service_dicts", Array{bare, bare, bare}}}));
  ASSERT_THAT(services, SizeIs(3));
  EXPECT_EQ(services[0], dictionary({{"QVBundlePath", path},
                                     {"QVBundleIdentifier", "org.demo"},
                                     {"QVMenuItem", dictionary({})},
                                     {"QVKeyEquivalent", dictionary({})},
                                     {"QVUUID", Bytes{0xca, 0x83, 0x3f, 0xa9, 0xc8, 0x1c, 0xa5, 0x2f, 0xc8,
                                                      0x56, 0xdd, 0x89, 0xc9, 0xce, 0x33, 0x2d}}}));
  EXPECT_EQ(*services[2].find("QVUUID"), Value(Bytes{0x7f, 0x37, 0x23, 0x40, 0xc9, 0x6c, 0xe3, 0xa7, 0x03,
                                                     0xe8, 0x7b, 0xa8, 0x43, 0x70, 0x6c, 0x80}));
  EXPECT_EQ(rest({}), Dictionary()) << "no identifier where the entry has none";
}

TEST_F(NormalisationTest, KeysAreCarriedOverInTheirCanonicalFormWhenTheirValueIsOfTheRightKind) {
  using Row = std::tuple<Names, Array, Array>;
  const Value array(Array{"a"});
  for (const auto& [keys, kept, dropped] : {
           Row{{"QVMessage", "QVPortName", "QVHost", "QVUserData"}, {"a", ""}, {1, array}},
           Row{{"QVSendTypes", "QVReturnTypes", "QVLanguages"}, {array}, {1, "a"}},
           Row{{"QVInputMechanism", "QVRequiredContext", "QVForbiddenContext"}, {1, "a", array}, {}},
           Row{{"QVTimeout", "QVSendFileTypes"}, {1, "a", array}, {}},
           Row{{"QVSupportsFileTranslation", "QVSupportsDataTranslation", "QVIcon"}, {}, {true, "a"}},
       }) {
    for (const std::string& key : keys) {
      std::string odd = " ";
      for (const char c : key) odd.append("\t ").push_back(static_cast<char>(std::tolower(c)));
      for (const Value& value : kept) EXPECT_EQ(rest({{odd, value}}), dictionary({{key, value}}));
      for (const Value& value : dropped) EXPECT_EQ(rest({{key, value}}), Dictionary()) << key;
    }
  }
  EXPECT_EQ(rest({{"QVTIMEOUT", 1}, {"QVSPELLCHEC\u212AER", 2}, {"QV\nHost", "a"}, {"QVHost\u00a0", "a"}}),
            dictionary({{"QVTimeout", 1}, {"QVSpellChecker", 2}}));
  EXPECT_EQ(rest({{std::string(1 << 20, ' ') + "QVHost", "a"}, {std::string(1 << 20, 'q'), "a"}}),
            dictionary({{"QVHost", "a"}}));
}

TEST_F(NormalisationTest, EarlierKindsOfServiceHideTheLaterOnes) {
  const Entries translations{{"QVSupportsFileTranslation", true}, {"QVSupportsDataTranslation", 0}};
  const auto with = [&](Entries entries) {
    entries.insert(entries.end(), translations.begin(), translations.end());
    return entries;
  };
  EXPECT_EQ(rest(with({{"QVSpellChecker", "s"}, {"QVFilter", "f"}, {"QVMessage", "m"}})),
            dictionary({{"QVSpellChecker", "s"}, {"QVMessage", "s"}}));
  EXPECT_EQ(rest(with({{"QVFilter", "f"}, {"QVMessage", "m"}})),
            dictionary(with({{"QVFilter", "f"}, {"QVMessage", "f"}})));
  for (const char* kind : {"QVSpellChecker", "QVFilter"})
    EXPECT_EQ(rest({{kind, 1}, {"QVMessage", "m"}}), dictionary({{kind, 1}}));
  EXPECT_EQ(rest({{"QVSendTypes", Array{"s"}}, {"QVLanguages", Array{"l"}}}),
            dictionary({{"QVSendTypes", Array{"s"}}}));
  EXPECT_EQ(rest({{"QVSendTypes", "s"}, {"QVLanguages", Array{"l"}}}), Dictionary());
}

TEST_F(NormalisationTest, TitlesAndKeyEquivalentsKeepTheirStringsAndAreTranslatedFromTheDefault) {
  const auto pairs = dictionary({{"default", ""}, {"German", "G"}, {"French", 1}});
  EXPECT_EQ(rest({{"QVMenuItem", pairs}, {"QVKeyEquivalent", pairs}}),
            dictionary({{"QVMenuItem", dictionary({{"default", ""}, {"German", "G"}})},
                        {"QVKeyEquivalent", dictionary({{"German", "G"}})}}));
  EXPECT_EQ(rest({{"QVMenuItem", Array{"M"}}, {"QVKeyEquivalent", ""}}),
            dictionary({{"QVKeyEquivalent", dictionary({{"default", ""}})}}));

  const auto tables = dictionary({{"English", dictionary({{"Close", "Close It"}})},
                                  {"French", false},
                                  {"German", dictionary({{"Open", "Öffnen"}, {"o", "ö"}})},
                                  {"Odd", dictionary({{"Open", 7}})},
                                  {"default", dictionary({{"Open", "Replaced"}})}});
  const auto titles = dictionary({{"default", "Open"}, {"German", "old"}, {"Dutch", "Open"}});
  const auto translated =
      dictionary({{"default", "Replaced"}, {"Dutch", "Open"}, {"German", "Öffnen"}, {"Odd", 7}});
  EXPECT_EQ(rest({{"QVMenuItem", titles}, {"QVKeyEquivalent", "o"}}, tables),
            dictionary({{"QVMenuItem", translated},
                        {"QVKeyEquivalent", dictionary({{"default", "o"}, {"German", "ö"}})}}));
  const Entries untitled{{"QVMenuItem", dictionary({{"English", "Open"}})}};
  EXPECT_EQ(rest(untitled, tables), dictionary(untitled));
}

TEST_F(NormalisationTest, RestrictedIsReadAsABoolean) {
  const double notANumber = std::numeric_limits<double>::quiet_NaN();
  const Array yes{true,  1,       -1,           0.5,     notANumber,
                  "YES", "yes",   "true",       "T",     " \t\n+007",
                  "-1",  Array{}, Dictionary(), Bytes{}, platform::PropertyListDate{}};
  const Array no{false, 0, 0.0, -0.0, "0.5", "000", "NO", "false", "+-1", "+ 1", "", "  "};
  for (const bool expected : {true, false}) {
    for (const Value& declared : expected ? yes : no)
      EXPECT_EQ(rest({{"QVRestricted", declared}}), dictionary({{"QVRestricted", expected}}))
          << testing::PrintToString(declared);
  }
}

TEST_F(NormalisationTest, ValueThatCannotBeHandledCostsTheRestOfTheEntryOnly) {
  const auto titled = dictionary({{"QVMenuItem", "Open"}});
  const Dictionary::Entry services{"service_dicts", Array{dictionary({}), titled}};
  const Entries untranslated{services, {"loc_to_menu_strings", dictionary({{"Dutch", true}})}};
  const Entries large{{"bundle_id", std::string(1 << 20, 'i')}, {"service_dicts", Array(20, titled)}};
  using Row = std::tuple<Entries, std::size_t, std::string>;
  for (const auto& [fields, count, failure] : {
           Row{{{"service_dicts", "x"}}, 0, "the declared services are no array"},
           Row{{{"service_dicts", Array{titled, 7, titled}}}, 1, "service 1 is no dictionary"},
           Row{large, 15, "its services are too large"},
           Row{{services, {"loc_to_menu_strings", 7}}, 1, "the localized menu strings are no dictionary"},
           Row{untranslated, 1, "the menu strings of localization Dutch are neither a table nor false"},
       }) {
    EXPECT_THAT(publicServices(*cached(fields)), SizeIs(count)) << failure;
    EXPECT_THAT(system.log.take(),
                ElementsAre("Exception processing Services at path " + path + ": " + failure));
  }
}

struct ValidationTest : AppEntryTest {
  /// The messages about an entry with these fields, each on a line; the verdict must agree with them, with
  /// and without logging.
  std::string problems(Entries fields) {
    const auto examined = cached(std::move(fields));
    const bool valid = examined->validateEntryPlistFormatOptionallyLoggingErrors(false);
    EXPECT_THAT(system.log.take(), IsEmpty());
    EXPECT_EQ(examined->validateEntryPlistFormatOptionallyLoggingErrors(true), valid);
    const Names messages = system.log.take();
    EXPECT_EQ(messages.size(), valid ? 0U : 1U);
    if (messages.empty()) return {};
    const std::string heading = "Malformed Services entries in Info.plist for Service at URL " + path;
    EXPECT_THAT(messages[0], StartsWith(heading + "\n\t"));
    return messages[0].substr(heading.size());
  }
  std::string problemsOfService(Entries service) {
    return problems({{"service_dicts", Array{dictionary(std::move(service))}}});
  }

  static std::string itself(const std::string& key, const std::string& expected, const std::string& found) {
    return "\n\tThe value for key " + key + " was supposed to be of type " + expected +
           ", but instead it was of type " + found;
  }
  static std::string element(const std::string& key, const std::string& expected, const std::string& found) {
    return "\n\tThe value for key " + key + " was supposed to contain types " + expected +
           ", but instead it was found to contain type " + found;
  }
};

TEST_F(ValidationTest, BaseValuesAreAllTestedAndHideTheServicesWhichAreAllExamined) {
  EXPECT_EQ(problems({}), "");
  EXPECT_EQ(
      problems({{"bundle_id", true}, {"name", Bytes{1}}, {"vers", 1.0}, {"service_dicts", "x"}}),
      itself("KTBundleIdentifier", "QVString", "QVNumber") + itself("KTBundleName", "QVString", "QVData") +
          itself("KTBundleVersion", "QVString", "QVNumber") + itself("QVServices", "QVArray", "QVString"));
  EXPECT_EQ(problems({{"vers", platform::PropertyListDate{}}, {"service_dicts", Array{1}}}),
            itself("KTBundleVersion", "QVString", "QVDate"));
  EXPECT_EQ(problems({{"service_dicts",
                       Array{dictionary({{"QVHost", 1}}), "stray", dictionary({{"QVFilter", Array{}}})}}}),
            itself("QVHost", "QVString", "QVNumber") + element("QVServices", "QVDictionary", "QVString") +
                itself("QVFilter", "QVString", "QVArray"));
  const std::string report = problems({{"service_dicts", Array(1000, Array{})}});
  EXPECT_EQ(std::count(report.begin(), report.end(), '\n'), 201);
  EXPECT_THAT(report, testing::EndsWith("\n\tand 800 more"));
}

TEST_F(ValidationTest, EveryKnownKeyOfAServiceHasItsKindWhateverItsLetterCase) {
  for (const char* key : {"QVMessage", "QVHost", "QVUserData", "QVTimeout", "QVFilter", "QVSpellChecker",
                          "QVInputMechanism", "QVPortName", "QVMESSAGE", "qVSpellChec\u212Aer"}) {
    EXPECT_EQ(problemsOfService({{key, "text"}}), "") << key;
    EXPECT_EQ(problemsOfService({{key, 1}}), itself(key, "QVString", "QVNumber"));
  }
  for (const char* key : {"QVSendTypes", "QVReturnTypes", "QVSendFileTypes", "QVLanguages"}) {
    EXPECT_EQ(problemsOfService({{key, Array{}}}), "") << key;
    EXPECT_EQ(problemsOfService({{key, "text"}}), itself(key, "QVArray", "QVString"));
    EXPECT_EQ(problemsOfService({{key, Array{"text", 1, Array{}}}}), element(key, "QVString", "QVNumber"));
  }
  for (const char* key : {"QVMenuItem", "QVKeyEquivalent", "QV\u212AeyEquivalent"}) {
    EXPECT_EQ(problemsOfService({{key, dictionary({{"default", "x"}})}}), "") << key;
    EXPECT_EQ(problemsOfService({{key, "x"}}), itself(key, "QVDictionary", "QVString"));
    EXPECT_EQ(problemsOfService({{key, dictionary({{"a", Array{}}, {"b", 1}})}}),
              element(key, "QVString", "QVArray"));
  }
  for (const std::string key : {"QV Message", "QVMessage\t", "QVMessages", "QVMessag", "", "Icon"})
    EXPECT_EQ(problemsOfService({{key, Array{1}}, {std::string(1 << 20, 'Q'), 1}}), "") << key;
}

TEST_F(ValidationTest, ContextsAreDictionariesOrArraysOfThem) {
  const auto badLimit = dictionary({{"QVWordLimit", "many"}});
  for (const char* key : {"QVRequiredContext", "QVForbiddenContext"}) {
    EXPECT_EQ(problemsOfService({{key, dictionary({{"QVWordLimit", true}, {"Other", 1}})}}), "") << key;
    EXPECT_EQ(problemsOfService({{key, "x"}}), itself(key, "QVDictionary", "QVString"));
    EXPECT_EQ(problemsOfService({{key, Array{badLimit, Array{}, badLimit}}}),
              itself("QVWordLimit", "QVNumber", "QVString") + element(key, "QVDictionary", "QVArray") +
                  itself("QVWordLimit", "QVNumber", "QVString"));
  }
  for (const char* key : {"QVApplicationIdentifier", "QVTextScript", "QVTextLanguage", "QVTextContent"}) {
    const auto context = [&](Value value) {
      return problemsOfService({{"QVRequiredContext", dictionary({{key, std::move(value)}})}});
    };
    EXPECT_EQ(context("x") + context(Array{"x", "y"}), "") << key;
    EXPECT_EQ(context(1), itself(key, "QVString", "QVNumber"));
    EXPECT_EQ(context(Array{"x", 1, 2}), element(key, "QVString", "QVNumber"));
  }
}

}  // namespace
}  // namespace kel::test
