#include "restrictions/restriction_lists.h"

#include <gmock/gmock.h>
#include <string>
#include <vector>

#include "support/in_memory_directories.h"
#include "support/in_memory_files.h"
#include "support/print.h"

namespace kel {
namespace {

using platform::PropertyListArray;
using platform::PropertyListDictionary;
using platform::PropertyListDictionaryBuilder;
using platform::PropertyListValue;
using testing::ElementsAre;
using testing::IsEmpty;

PropertyListDictionary dictionary(std::vector<PropertyListDictionary::Entry> entries) {
  return PropertyListDictionary(std::move(entries));
}

PropertyListDictionary row(PropertyListValue bundleID, PropertyListValue title) {
  return dictionary({{"QVBundleID", std::move(bundleID)}, {"QVMenuItem", std::move(title)}});
}

PropertyListDictionary service(PropertyListValue bundleID, PropertyListValue titles) {
  return dictionary({{"QVBundleIdentifier", std::move(bundleID)}, {"QVMenuItem", std::move(titles)}});
}

std::vector<std::string> rows(const std::vector<KELRestrictionListEntry>& entries) {
  std::vector<std::string> result;
  for (const KELRestrictionListEntry& entry : entries)
    result.push_back(entry.bundleID().text() + ":" + entry.title().text());
  return result;
}

TEST(RestrictionListEntryTest, EntriesAreEqualInBothStringsAndHashByTitle) {
  const auto entry = KELRestrictionListEntry::initWithBundleID("com.orvex.A", "Menu/Item");
  const auto otherBundle = KELRestrictionListEntry::initWithBundleID("com.orvex.B", "Menu/Item");
  EXPECT_EQ(entry, KELRestrictionListEntry::initWithBundleID("com.orvex.A", "Menu/Item"));
  EXPECT_NE(entry, otherBundle);
  EXPECT_NE(entry, KELRestrictionListEntry::initWithBundleID("com.orvex.A", "menu/item"));
  EXPECT_EQ(entry->hash(), otherBundle->hash());
  EXPECT_FALSE(KELRestrictionListEntry::initWithBundleID(std::nullopt, "Menu/Item"));
  EXPECT_FALSE(KELRestrictionListEntry::initWithBundleID("com.orvex.A", std::nullopt));
}

TEST(RestrictionListsTest, RowsOfAnUnexpectedShapeDropOutAndTheOthersKeepTheirOrder) {
  const auto lists = restriction_lists_from_plist(dictionary(
      {{"QVUnrestricted",
        PropertyListArray{row("b", "2"), "no row", dictionary({{"QVBundleID", "x"}}), row(7, "3"),
                          row("c", PropertyListArray{}), dictionary({{"QVMenuItem", "x"}}), row("a", "1")}},
       {"QVRestricted", "no array"}}));
  ASSERT_TRUE(lists);
  EXPECT_THAT(rows(lists->unrestricted), ElementsAre("b:2", "a:1"));
  EXPECT_THAT(lists->restricted, IsEmpty());
}

TEST(RestrictionListsTest, StorableFormKeepsNoneAndEmptyApart) {
  EXPECT_FALSE(restriction_lists_from_plist(std::nullopt));
  EXPECT_FALSE(restriction_lists_to_plist(nullptr));
  const auto empty = restriction_lists_from_plist(PropertyListDictionary());
  ASSERT_TRUE(empty);
  EXPECT_EQ(restriction_lists_to_plist(empty.get()),
            dictionary({{"QVUnrestricted", PropertyListArray{}}, {"QVRestricted", PropertyListArray{}}}));

  const auto stored = dictionary({{"QVUnrestricted", PropertyListArray{row("b", "2"), row("a", "1")}},
                                  {"QVRestricted", PropertyListArray{row("c", "3"), row("c", "3")}}});
  EXPECT_EQ(restriction_lists_to_plist(restriction_lists_from_plist(stored).get()), stored);
}

struct Marking {
  std::string name;
  PropertyListDictionary service;
  std::optional<PropertyListValue> expected;  // under "QVRestricted"
};

class ApplyRestrictionListsTest : public testing::Test {
 protected:
  static void expectMarks(const KELRestrictionLists* lists, const std::vector<Marking>& markings) {
    std::vector<PropertyListDictionaryBuilder> services;
    for (const Marking& marking : markings) services.emplace_back(marking.service);
    apply_restriction_lists(services, lists);
    for (std::size_t i = 0; i < markings.size(); ++i) {
      PropertyListDictionaryBuilder expected(markings[i].service);
      if (markings[i].expected) expected.set("QVRestricted", *markings[i].expected);
      EXPECT_EQ(services[i].build(), expected.build()) << markings[i].name;
    }
  }

  static PropertyListDictionary titled(const char* title) { return dictionary({{"default", title}}); }
};

TEST_F(ApplyRestrictionListsTest, MarksWhatTheRulesRestrictAndNothingElse) {
  const auto lists = restriction_lists_from_plist(dictionary(
      {{"QVUnrestricted",
        PropertyListArray{row("com.orvex.A", "Free"), row("com.orvex.A", "Both"), row("org.other", "Free")}},
       {"QVRestricted", PropertyListArray{row("com.orvex.A", "Both"), row("org.other", "Bound")}}}));
  PropertyListDictionaryBuilder declared(service("org.other", titled("Bound")));
  declared.set("QVRestricted", false);

  expectMarks(lists.get(),
              {{"vendor, unrestricted", service("com.orvex.A", titled("Free")), {}},
               {"vendor, in both lists", service("com.orvex.A", titled("Both")), true},
               {"vendor, in no list", service("com.orvex.A", titled("New")), true},
               {"vendor, other letter case", service("com.orvex.A", titled("free")), true},
               {"vendor, title of another bundle", service("com.orvex.B", titled("Free")), true},
               {"no vendor, other case of the prefix", service("com.Orvex.A", titled("New")), {}},
               {"no vendor, prefix without dot", service("com.orvexample", titled("New")), {}},
               {"other, unrestricted", service("org.other", titled("Free")), {}},
               {"other, restricted", service("org.other", titled("Bound")), true},
               {"declared false stands", declared.build(), false},
               {"English title", service("com.orvex.A", dictionary({{"English", "Free"}})), {}},
               {"default before English",
                service("com.orvex.A", dictionary({{"default", "New"}, {"English", "Free"}})), true},
               {"neither title", service("com.orvex.A", dictionary({{"German", "Neu"}})), {}},
               {"no titles", dictionary({{"QVBundleIdentifier", "com.orvex.A"}}), {}},
               {"titles of another kind", service("com.orvex.A", "New"), {}},
               {"identifier of another kind", service(7, titled("New")), {}}});
}

TEST_F(ApplyRestrictionListsTest, WithoutListsEveryVendorServiceIsMarked) {
  expectMarks(nullptr, {{"vendor", service("com.orvex.A", titled("Free")), true},
                        {"other", service("org.other", titled("Bound")), {}}});
}

TEST(RestrictionsFileTest, IsReadAnewFromTheLastSystemLibraryDirectory) {
  test::InMemoryFileSystem files;
  test::InMemoryDirectories directories;
  directories.set({.systemLibraries = {"/Old/Library", "/System/Library"}});
  const std::string path = "/System/Library/CoreAgents/com.orvex.QVServicesRestrictions.plist";
  EXPECT_FALSE(load_restrictions_file(files, directories)) << "missing file";

  const auto contents = dictionary({{"QVRestricted", PropertyListArray{row("a", "1")}}});
  files.addPropertyList(path, contents);
  EXPECT_EQ(load_restrictions_file(files, directories), contents);
  files.addPropertyList(path, PropertyListArray{});
  EXPECT_FALSE(load_restrictions_file(files, directories)) << "no dictionary";
  files.addText(path, "<plist");
  EXPECT_FALSE(load_restrictions_file(files, directories)) << "no property list";
  directories.set({.systemLibraries = {}});
  EXPECT_FALSE(load_restrictions_file(files, directories)) << "no library directory";
}

}  // namespace
}  // namespace kel
