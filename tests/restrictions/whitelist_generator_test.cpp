#include "restrictions/whitelist_generator.h"

#include <gmock/gmock.h>
#include <set>
#include <sstream>
#include <vector>

#include "restrictions/restriction_lists.h"
#include "support/in_memory_platform.h"
#include "support/print.h"

namespace kel {
namespace {

using platform::PropertyListArray;
using platform::PropertyListDictionary;
using platform::PropertyListValue;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::SizeIs;

class WhitelistGeneratorTest : public testing::Test {
 protected:
  static PropertyListDictionary dictionary(std::vector<PropertyListDictionary::Entry> entries) {
    return PropertyListDictionary(std::move(entries));
  }

  static PropertyListDictionary service(std::string_view bundleID, std::string_view title) {
    return dictionary({{"QVBundleIdentifier", bundleID}, {"QVMenuItem", dictionary({{"default", title}})}});
  }

  void publish(PropertyListArray services) {
    system.publication.publish(dictionary({{"KTVendedServices", std::move(services)}}));
  }

  std::string generate() {
    std::ostringstream out;
    generate_whitelist(system.platform, out);
    return out.str();
  }

  /// The rows of the written file's unrestricted list.
  std::vector<std::string> writtenRows() {
    const auto reading = platform::readDictionaryFile(system.files, file, platform::largestOwnFile);
    const auto lists = restriction_lists_from_plist(reading.dictionary);
    if (!lists) return {"no file"};
    EXPECT_EQ(restriction_lists_to_plist(lists.get()), reading.dictionary);
    EXPECT_THAT(lists->restricted, IsEmpty());
    std::vector<std::string> rows;
    for (const KELRestrictionListEntry& entry : lists->unrestricted)
      rows.push_back(entry.bundleID().text() + ":" + entry.title().text());
    return rows;
  }

  static std::string notFound(const BlacklistRow& row) {
    return "Blacklisted Service '" + std::string(row.bundleID) + ":" + std::string(row.title) +
           "' not found. Perhaps the blacklist needs to be updated?";
  }

  test::InMemoryPlatform system;
  const std::string file = "/tmp/u/com.orvex.QVServicesRestrictions.plist";

  WhitelistGeneratorTest() { system.files.addDirectory("/tmp/u"); }
};

TEST_F(WhitelistGeneratorTest, ListsVendorServicesInOrderWithoutTheBlacklistedOnes) {
  const BlacklistRow& first = default_blacklist[0];
  const BlacklistRow& last = default_blacklist[7];
  publish({service("com.orvex.B", "Two"), service(first.bundleID, first.title), service("org.other", "Three"),
           "stray", service("com.orvex.A", "One"), service(first.bundleID, first.title),
           service("com.orvex.B", "Two"), dictionary({{"QVBundleIdentifier", "com.orvex.C"}}),
           service(last.bundleID, last.title)});
  EXPECT_EQ(generate(), "Wrote to " + file + "\n");
  EXPECT_THAT(writtenRows(), ElementsAre("com.orvex.B:Two", "com.orvex.A:One", "com.orvex.B:Two"));
  std::vector<std::string> expected;
  for (std::size_t i = 1; i < 7; ++i) expected.push_back(notFound(default_blacklist[i]));
  EXPECT_EQ(system.log.messages(), expected);
}

TEST_F(WhitelistGeneratorTest, PublicationOfAnotherShapeGivesEmptyLists) {
  for (const PropertyListValue& publication :
       {PropertyListValue("text"), PropertyListValue(dictionary({})),
        PropertyListValue(dictionary({{"KTVendedServices", "text"}}))}) {
    system.publication.publish(publication);
    EXPECT_EQ(generate(), "Wrote to " + file + "\n");
    EXPECT_THAT(writtenRows(), IsEmpty());
    EXPECT_THAT(system.log.take(), SizeIs(8));
  }
}

TEST_F(WhitelistGeneratorTest, NothingIsWrittenWithoutServicesOrUnderTheLauncher) {
  EXPECT_EQ(generate(),
            "No services (com.orvex.ServicesMenu.Services missing or empty in QVServices preferences)\n");
  publish({});
  system.facts.environment["QVRunningFromWarden"] = "1";
  EXPECT_EQ(generate(), "");
  EXPECT_FALSE(system.files.isFile(file));
  EXPECT_THAT(system.log.messages(), IsEmpty());
}

TEST_F(WhitelistGeneratorTest, FailureToWriteIsLogged) {
  publish({});
  system.files.failNextWrite("disk full");
  EXPECT_EQ(generate(), "");
  EXPECT_EQ(system.log.take().back(), "Unable to write to path '" + file + "': disk full");
  system.directories.set({.temporary = std::nullopt});
  EXPECT_EQ(generate(), "");
  EXPECT_EQ(system.log.take().back(),
            "Unable to write to path 'com.orvex.QVServicesRestrictions.plist': there is no safe temporary "
            "directory");
}

TEST_F(WhitelistGeneratorTest, BlacklistHoldsEightVendorRowsOfSixBundles) {
  std::set<std::string_view> bundles;
  std::size_t grouped = 0;
  for (const auto& [bundleID, title] : default_blacklist) {
    EXPECT_TRUE(is_vendor_service(service(bundleID, title)));
    bundles.insert(bundleID);
    grouped += title.find('/') != std::string_view::npos ? 1 : 0;
  }
  EXPECT_THAT(bundles, SizeIs(6));
  EXPECT_EQ(grouped, 5u);
}

}  // namespace
}  // namespace kel
