#include <sstream>

#include "restrictions/restriction_lists.h"
#include "restrictions/whitelist_generator.h"
#include "support/in_memory_platform.h"
#include "support/property_lists.h"

namespace kel::test {
namespace {

Dictionary row(Value bundleID, Value title) {
  return dictionary({{"QVBundleID", std::move(bundleID)}, {"QVMenuItem", std::move(title)}});
}

Dictionary service(Value bundleID, Value titles) {
  return dictionary({{"QVBundleIdentifier", std::move(bundleID)}, {"QVMenuItem", std::move(titles)}});
}

Dictionary titled(std::string_view bundleID, std::string_view title) {
  return service(bundleID, dictionary({{"default", title}}));
}

TEST(RestrictionListsTest, StorableFormKeepsOrderAndEmptinessAndLeavesOddRowsOut) {
  EXPECT_FALSE(restriction_lists_from_plist(std::nullopt) || restriction_lists_to_plist(nullptr));
  const auto lists = [](Value unrestricted, Value restricted) {
    return dictionary({{"QVUnrestricted", std::move(unrestricted)}, {"QVRestricted", std::move(restricted)}});
  };
  const auto ordered = lists(Array{row("b", "2"), row("a", "1")}, Array{row("c", "3"), row("c", "3")});
  const auto odd = lists("no array", Array{row("b", "2"), "no row", row(7, "3"), row("c", Array{}),
                                           dictionary({{"QVBundleID", "x"}}), row("a", "1")});
  using Row = std::pair<Dictionary, Dictionary>;
  for (const auto& [read, stored] : {Row{{}, lists(Array{}, Array{})}, Row{ordered, ordered},
                                     Row{odd, lists(Array{}, Array{row("b", "2"), row("a", "1")})}})
    EXPECT_EQ(restriction_lists_to_plist(restriction_lists_from_plist(read).get()), stored);
}

TEST(RestrictionListsTest, MarksWhatTheRulesRestrictAndNothingElse) {
  const auto lists = restriction_lists_from_plist(
      dictionary({{"QVUnrestricted",
                   Array{row("com.orvex.A", "Free"), row("com.orvex.A", "Both"), row("org.other", "Free")}},
                  {"QVRestricted", Array{row("com.orvex.A", "Both"), row("org.other", "Bound")}}}));
  const auto isMarked = [](const Dictionary& declared, const KELRestrictionLists* by) {
    std::vector<DictionaryBuilder> services{DictionaryBuilder(declared)};
    apply_restriction_lists(services, by);
    const Value* mark = services[0].find("QVRestricted");
    return mark && *mark == true;
  };
  DictionaryBuilder declared(titled("org.other", "Bound"));
  declared.set("QVRestricted", false);
  const Array marked{titled("com.orvex.A", "Both"), titled("com.orvex.A", "free"),
                     titled("com.orvex.B", "Free"), titled("org.other", "Bound"),
                     service("com.orvex.A", dictionary({{"default", "New"}, {"English", "Free"}}))};
  const Array unmarked = listOf<Value>(
      titled("com.orvex.A", "Free"), titled("com.Orvex.A", "New"), titled("com.orvexample", "New"),
      titled("org.other", "Free"), declared.build(), dictionary({{"QVBundleIdentifier", "com.orvex.A"}}),
      service("com.orvex.A", dictionary({{"English", "Free"}})), service("com.orvex.A", "New"),
      service("com.orvex.A", dictionary({{"German", "Neu"}})), service(7, dictionary({{"default", "New"}})));
  for (const bool expected : {true, false}) {
    for (const Value& each : expected ? marked : unmarked)
      EXPECT_EQ(isMarked(*each.asDictionary(), lists.get()), expected) << testing::PrintToString(each);
  }
  EXPECT_TRUE(isMarked(titled("com.orvex.A", "Free"), nullptr));
  EXPECT_FALSE(isMarked(titled("org.other", "Bound"), nullptr));
}

TEST(RestrictionListsTest, FileIsReadAnewFromTheLastSystemLibraryDirectory) {
  InMemoryPlatform system;
  const auto load = [&] { return load_restrictions_file(system.platform).dictionary; };
  system.directories.systemLibraries = {"/Old/Library", "/System/Library"};
  const auto contents = dictionary({{"QVRestricted", Array{row("a", "1")}}});
  system.files.addPropertyList(restrictionsPath, contents);
  EXPECT_EQ(load(), contents);
  EXPECT_THAT(system.log.take(), IsEmpty());
  system.files.addPropertyList(restrictionsPath, Array{});
  EXPECT_FALSE(load());
  EXPECT_THAT(system.log.take(), ElementsAre("Cannot read the restrictions file " + restrictionsPath +
                                             ": the top level is not a dictionary"));
  system.directories.systemLibraries.clear();
  EXPECT_FALSE(load()) << "no library directory";
}

struct WhitelistGeneratorTest : testing::Test {
  void publish(Array services) {
    system.publication.publish(dictionary({{"KTVendedServices", std::move(services)}}));
  }
  std::string generate() {
    std::ostringstream out;
    generate_whitelist(system.platform, out);
    return out.str();
  }
  Dictionary written() {
    return platform::readDictionaryFile(system.files, file, platform::largestOwnFile).dictionary.value();
  }

  InMemoryPlatform system;
  const std::string file = "/tmp/u/com.orvex.QVServicesRestrictions.plist";
};

TEST_F(WhitelistGeneratorTest, ListsVendorServicesInOrderWithoutTheBlacklistedOnes) {
  const BlacklistRow& first = default_blacklist[0];
  const BlacklistRow& last = default_blacklist[7];
  publish({titled("com.orvex.B", "Two"), titled(first.bundleID, first.title), titled("org.other", "Three"),
           "stray", titled("com.orvex.A", "One"), titled(first.bundleID, first.title),
           titled("com.orvex.B", "Two"), dictionary({{"QVBundleIdentifier", "com.orvex.C"}}),
           titled(last.bundleID, last.title)});
  EXPECT_EQ(generate(), "Wrote to " + file + "\n");
  const Array rows{row("com.orvex.B", "Two"), row("com.orvex.A", "One"), row("com.orvex.B", "Two")};
  EXPECT_EQ(written(), dictionary({{"QVUnrestricted", rows}, {"QVRestricted", Array{}}}));
  Names expected;
  for (const auto& [bundleID, title] : std::span(default_blacklist).subspan(1, 6))
    expected.push_back("Blacklisted Service '" + std::string(bundleID) + ":" + std::string(title) +
                       "' not found. Perhaps the blacklist needs to be updated?");
  EXPECT_EQ(system.log.take(), expected);
}

TEST_F(WhitelistGeneratorTest, OddPublicationsGiveEmptyListsAndTheServerWritesNoFile) {
  for (const Value& publication : {Value("text"), Value(dictionary({{"KTVendedServices", "text"}}))}) {
    system.publication.publish(publication);
    EXPECT_EQ(generate(), "Wrote to " + file + "\n");
    EXPECT_EQ(written(), dictionary({{"QVUnrestricted", Array{}}, {"QVRestricted", Array{}}}));
    EXPECT_THAT(system.log.take(), SizeIs(8));
  }
  system.files.removeTree(file);
  system.facts.environment["QVRunningFromWarden"] = "1";
  EXPECT_EQ(generate(), "") << "under the launcher";
  EXPECT_FALSE(system.files.isFile(file));
}

TEST_F(WhitelistGeneratorTest, FailureToWriteIsLogged) {
  publish({});
  system.files.failNextWrite("disk full");
  EXPECT_EQ(generate(), "");
  EXPECT_EQ(system.log.take().back(), "Unable to write to path '" + file + "': disk full");
  system.directories.temporary = std::nullopt;
  EXPECT_EQ(generate(), "");
  EXPECT_EQ(system.log.take().back(),
            "Unable to write to path 'com.orvex.QVServicesRestrictions.plist': there is no safe temporary "
            "directory");
}

}  // namespace
}  // namespace kel::test
