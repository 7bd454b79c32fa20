#include <limits>

#include "entries/entry_fixture.h"

namespace kel::test {
namespace {

using platform::Bytes;
using platform::PropertyListDictionary;
using platform::PropertyListDictionaryBuilder;
using testing::ElementsAre;
using testing::IsEmpty;

using Entries = std::vector<PropertyListDictionary::Entry>;

class NormalisationTest : public EntryTest {
 protected:
  static std::vector<PropertyListDictionary> publicServices(const KELAppEntry& entry) {
    std::vector<PropertyListDictionaryBuilder> services;
    entry.addPublicDictionariesForServices(services);
    std::vector<PropertyListDictionary> result;
    for (const PropertyListDictionaryBuilder& service : services) result.push_back(service.build());
    return result;
  }

  PropertyListDictionary publicForm(Entries declared, Value tables = PropertyListDictionary()) {
    const auto services = publicServices(*cached({{"service_dicts", Array{dictionary(std::move(declared))}},
                                                  {"loc_to_menu_strings", std::move(tables)}}));
    EXPECT_THAT(services, testing::SizeIs(1));
    return services.at(0);
  }

  /// The public form without what every service has, or is empty when it is not declared.
  PropertyListDictionary rest(Entries declared) {
    Entries left;
    for (const auto& [key, value] : publicForm(std::move(declared))) {
      const PropertyListDictionary* titles = value.asDictionary();
      const bool isEmptyTitle =
          titles && titles->empty() && (key.text() == "QVMenuItem" || key.text() == "QVKeyEquivalent");
      if (!isEmptyTitle && key.text() != "QVBundlePath" && key.text() != "QVUUID")
        left.emplace_back(key, value);
    }
    return dictionary(std::move(left));
  }
};

TEST_F(NormalisationTest, EveryServiceHasPathIdentifierTitlesAndAnIdentityOfItsPathAndPlace) {
  const auto entry =
      cached({{"bundle_id", "org.demo"},
              {"service_dicts", Array{dictionary({{"Icon", "x"}}), dictionary({}), dictionary({})}}});
  const auto services = publicServices(*entry);
  ASSERT_THAT(services, testing::SizeIs(3));
  EXPECT_EQ(services[0], dictionary({{"QVBundlePath", path},
                                     {"QVBundleIdentifier", "org.demo"},
                                     {"QVMenuItem", dictionary({})},
                                     {"QVKeyEquivalent", dictionary({})},
                                     {"QVUUID", Bytes{0xca, 0x83, 0x3f, 0xa9, 0xc8, 0x1c, 0xa5, 0x2f, 0xc8,
                                                      0x56, 0xdd, 0x89, 0xc9, 0xce, 0x33, 0x2d}}}));
  EXPECT_EQ(*services[2].find("QVUUID"), Value(Bytes{0x7f, 0x37, 0x23, 0x40, 0xc9, 0x6c, 0xe3, 0xa7, 0x03,
                                                     0xe8, 0x7b, 0xa8, 0x43, 0x70, 0x6c, 0x80}));
  EXPECT_FALSE(publicForm({}).find("QVBundleIdentifier")) << "the entry has none";
}

TEST_F(NormalisationTest, KeysAreCarriedOverInTheirCanonicalFormWhenTheirValueIsOfTheRightKind) {
  struct Row {
    std::string key;
    std::vector<Value> kept;
    std::vector<Value> dropped;
  };
  const Array array{"a"};
  const std::vector<Row> rows{{"QVMessage", {"a", ""}, {1, array}},
                              {"QVPortName", {"a"}, {1, array}},
                              {"QVHost", {"a"}, {1, array}},
                              {"QVUserData", {"a"}, {1, array}},
                              {"QVSendTypes", {array}, {1, "a"}},
                              {"QVReturnTypes", {array}, {1, "a"}},
                              {"QVLanguages", {array}, {1, "a"}},
                              {"QVInputMechanism", {1, "a", array}, {}},
                              {"QVRequiredContext", {1, "a", array}, {}},
                              {"QVForbiddenContext", {1, "a", array}, {}},
                              {"QVTimeout", {1, "a", array}, {}},
                              {"QVSendFileTypes", {1, "a", array}, {}},
                              {"QVSupportsFileTranslation", {}, {true}},
                              {"QVSupportsDataTranslation", {}, {true}},
                              {"QVIcon", {}, {"a"}}};
  for (const Row& row : rows) {
    std::string odd = " ";
    for (const char c : row.key) odd.append("\t ").push_back(static_cast<char>(std::tolower(c)));
    for (const Value& value : row.kept) {
      EXPECT_EQ(rest({{row.key, value}}), dictionary({{row.key, value}}));
      EXPECT_EQ(rest({{odd, value}}), dictionary({{row.key, value}})) << "blanks and lower case";
    }
    for (const Value& value : row.dropped) EXPECT_EQ(rest({{row.key, value}}), dictionary({})) << row.key;
  }
  EXPECT_EQ(rest({{"QVTIMEOUT", 1}, {"QVSPELLCHEC\u212AER", 2}, {"QV\nHost", "a"}, {"QVHost\u00a0", "a"}}),
            dictionary({{"QVTimeout", 1}, {"QVSpellChecker", 2}}));
  EXPECT_EQ(rest({{std::string(1 << 20, ' ') + "QVHost", "a"}, {std::string(1 << 20, 'q'), "a"}}),
            dictionary({{"QVHost", "a"}}));
}

TEST_F(NormalisationTest, EarlierKindsOfServiceHideTheLaterOnes) {
  EXPECT_EQ(rest({{"QVSpellChecker", "s"},
                  {"QVFilter", "f"},
                  {"QVSupportsFileTranslation", true},
                  {"QVMessage", "m"}}),
            dictionary({{"QVSpellChecker", "s"}, {"QVMessage", "s"}}));
  EXPECT_EQ(rest({{"QVFilter", "f"},
                  {"QVSupportsFileTranslation", true},
                  {"QVSupportsDataTranslation", 0},
                  {"QVMessage", "m"}}),
            dictionary({{"QVFilter", "f"},
                        {"QVSupportsFileTranslation", true},
                        {"QVSupportsDataTranslation", 0},
                        {"QVMessage", "f"}}));
  EXPECT_EQ(rest({{"QVSpellChecker", 1}, {"QVMessage", "m"}}), dictionary({{"QVSpellChecker", 1}}));
  EXPECT_EQ(rest({{"QVFilter", 1}, {"QVMessage", "m"}}), dictionary({{"QVFilter", 1}}));

  EXPECT_EQ(rest({{"QVSendTypes", Array{"s"}}, {"QVLanguages", Array{"l"}}}),
            dictionary({{"QVSendTypes", Array{"s"}}}));
  EXPECT_EQ(rest({{"QVSendTypes", "s"}, {"QVLanguages", Array{"l"}}}), dictionary({}));
}

TEST_F(NormalisationTest, OneOfTwoKeysThatNormaliseAlikeIsUsed) {
  const PropertyListDictionary service = rest({{"QVHost", "a"}, {"qvhost", "b"}});
  EXPECT_THAT(service, testing::AnyOf(dictionary({{"QVHost", "a"}}), dictionary({{"QVHost", "b"}})));
}

TEST_F(NormalisationTest, TitlesAndKeyEquivalentsKeepTheirStrings) {
  const auto pairs = dictionary({{"default", ""}, {"German", "G"}, {"French", 1}});
  EXPECT_EQ(rest({{"QVMenuItem", pairs}, {"QVKeyEquivalent", pairs}}),
            dictionary({{"QVMenuItem", dictionary({{"default", ""}, {"German", "G"}})},
                        {"QVKeyEquivalent", dictionary({{"German", "G"}})}}));
  EXPECT_EQ(rest({{"QVMenuItem", "M"}, {"QVKeyEquivalent", ""}}),
            dictionary({{"QVMenuItem", dictionary({{"default", "M"}})},
                        {"QVKeyEquivalent", dictionary({{"default", ""}})}}));
  EXPECT_EQ(rest({{"QVMenuItem", Array{"M"}}, {"QVKeyEquivalent", 1}}), dictionary({}));
}

TEST_F(NormalisationTest, RestrictedIsReadAsABoolean) {
  const std::vector<std::pair<Value, bool>> readings{{true, true},
                                                     {false, false},
                                                     {1, true},
                                                     {-1, true},
                                                     {0, false},
                                                     {0.5, true},
                                                     {0.0, false},
                                                     {-0.0, false},
                                                     {std::numeric_limits<double>::quiet_NaN(), true},
                                                     {"YES", true},
                                                     {"yes", true},
                                                     {"true", true},
                                                     {"T", true},
                                                     {" \t\n+007", true},
                                                     {"-1", true},
                                                     {"0.5", false},
                                                     {"000", false},
                                                     {"NO", false},
                                                     {"false", false},
                                                     {"+-1", false},
                                                     {"+ 1", false},
                                                     {"", false},
                                                     {"  ", false},
                                                     {Array{}, true},
                                                     {dictionary({}), true},
                                                     {Bytes{}, true},
                                                     {platform::PropertyListDate{}, true}};
  for (const auto& [declared, expected] : readings) {
    EXPECT_EQ(rest({{"QVRestricted", declared}}), dictionary({{"QVRestricted", expected}}))
        << testing::PrintToString(declared);
  }
}

TEST_F(NormalisationTest, LoadedTablesTranslateTheDefaultTitleAndKeyEquivalent) {
  const auto tables = dictionary({{"English", dictionary({{"Close", "Close It"}})},
                                  {"French", false},
                                  {"German", dictionary({{"Open", "Öffnen"}, {"o", "ö"}})},
                                  {"Odd", dictionary({{"Open", 7}})},
                                  {"default", dictionary({{"Open", "Replaced"}})}});
  const PropertyListDictionary service =
      publicForm({{"QVMenuItem", dictionary({{"default", "Open"}, {"German", "old"}, {"Dutch", "Open"}})},
                  {"QVKeyEquivalent", "o"}},
                 tables);
  EXPECT_EQ(
      *service.find("QVMenuItem"),
      Value(dictionary({{"default", "Replaced"}, {"Dutch", "Open"}, {"German", "Öffnen"}, {"Odd", 7}})));
  EXPECT_EQ(*service.find("QVKeyEquivalent"), Value(dictionary({{"default", "o"}, {"German", "ö"}})));

  const PropertyListDictionary untitled =
      publicForm({{"QVMenuItem", dictionary({{"English", "Open"}})}}, tables);
  EXPECT_EQ(*untitled.find("QVMenuItem"), Value(dictionary({{"English", "Open"}})));
}

TEST_F(NormalisationTest, ValueThatCannotBeHandledCostsTheRestOfTheEntryOnly) {
  const auto titled = dictionary({{"QVMenuItem", "Open"}});
  struct Row {
    Entries fields;
    std::size_t services;
    std::string failure;
  };
  const std::vector<Row> rows{
      {{{"service_dicts", "x"}}, 0, "the declared services are no array"},
      {{{"service_dicts", Array{titled, 7, titled}}}, 1, "service 1 is no dictionary"},
      {{{"service_dicts", Array{dictionary({}), titled}}, {"loc_to_menu_strings", 7}},
       1,
       "the localized menu strings are no dictionary"},
      {{{"service_dicts", Array{dictionary({}), titled}},
        {"loc_to_menu_strings", dictionary({{"Dutch", true}, {"German", dictionary({})}})}},
       1,
       "the menu strings of localization Dutch are neither a table nor false"}};
  for (const Row& row : rows) {
    EXPECT_THAT(publicServices(*cached(row.fields)), testing::SizeIs(row.services)) << row.failure;
    EXPECT_THAT(system.log.take(),
                ElementsAre("Exception processing Services at path " + path + ": " + row.failure));
  }
}

}  // namespace
}  // namespace kel::test
