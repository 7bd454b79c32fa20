#include <span>

#include "platform/linux/files/linux_bundles.h"
#include "platform/linux/files/linux_preferences.h"
#include "platform/linux/files/linux_services_publication.h"
#include "platform/linux/registry/linux_application_registry.h"
#include "platform/linux/scratch.h"
#include "support/in_memory_platform.h"
#include "support/property_lists.h"

// What the seams over files promise: files, bundles, preferences and the published list, applications.
namespace kel::platform {
namespace {

using namespace std::string_literals;
using namespace test;
using namespace testing;

struct InMemoryWorld : InMemoryPlatform {
  void install(const std::string& name, bool withServices) {
    (withServices ? registry.registered : registry.plain).push_back({root + name});
  }

  Preferences& preferences = publication;
  const std::string root = "/tmp/u/";
};

struct LinuxWorld {
  void install(const std::string& name, bool withServices) const {
    scratch.write(name + "/Info.plist", withServices ? "{ QVServices = ({}); }" : "{ QVServices = (); }");
  }

  Scratch scratch;
  const std::string root = scratch / "";
  RecordingLog log;
  ConcurrentQueue queue;
  LinuxFileSystem files{log};
  LinuxBundles bundles{files, log};
  LinuxServicesPublication publication{files, log, root};
  LinuxPreferences preferences{files, root, std::nullopt};
  LinuxApplicationRegistry registry{files, log, queue, {root}, std::nullopt, nullptr};
};

/// The services of one world, and files in a directory of the test's own.
template <class World>
struct FilesContract : testing::Test {
  enum Way { Atomically, Plainly };
  auto write(const std::string& name, std::string_view text = "", Way way = Atomically) {
    const auto writing = way == Plainly ? &FileSystem::writePlainly : &FileSystem::writeAtomically;
    return (files.*writing)(root + name, Bytes(text.begin(), text.end()));
  }
  /// The text of a file, or the reason why there is none.
  std::string read(const std::string& name, std::size_t largest = 9) {
    const FileReading reading = files.read(root + name, largest);
    return reading.bytes ? std::string(reading.bytes->begin(), reading.bytes->end()) : "E: " + reading.error;
  }
  auto list(const std::string& name) { return files.listDirectory(root + name).names; }
  bool exists(const std::string& name) { return files.exists(root + name); }
  bool remove(const std::string& name) { return files.remove(root + name); }

  World world;
  FileSystem& files = world.files;
  const std::string& root = world.root;
};
using Worlds = testing::Types<InMemoryWorld, LinuxWorld>;
TYPED_TEST_SUITE(FilesContract, Worlds);

TYPED_TEST(FilesContract, FileIsReadUpToTheLimitAndListedUntilItIsRemoved) {
  for (const std::string text : {"longer", "new"}) {
    EXPECT_FALSE(this->write("a/b/file", text) || this->write("a/.hidden", text, this->Plainly));
    EXPECT_EQ(this->read("a/b/file", text.size()) + this->read("a/.hidden", text.size()), text + text);
  }
  EXPECT_THAT(this->list("a"), Optional(UnorderedElementsAre("b", ".hidden")));
  EXPECT_FALSE(this->list("a/b/file") || this->list("none"));
  EXPECT_THAT(this->read("a/b/file", 2), StartsWith("E: "));
  for (const char* name : {"a", "none", "a/.hidden/x"})
    EXPECT_THAT(this->read(name), StartsWith("E: ")) << name;
  EXPECT_TRUE(this->exists("a/b/file") && this->remove("a/b/file"));
  EXPECT_FALSE(this->remove("a/b/file") || this->remove("a/b"));
  EXPECT_TRUE(this->exists("a/b") && this->exists("a/.hidden"));
  EXPECT_FALSE(this->exists("a/b/file") || this->exists("a/.hidden/x"));
}

TYPED_TEST(FilesContract, WriteThatCannotBeDoneSaysWhyAndChangesNothing) {
  this->write("a/file", "old");
  for (const char* name : {"a", "a/file/below"})
    EXPECT_TRUE(this->write(name, "new") && this->write(name, "new", this->Plainly)) << name;
  EXPECT_TRUE(this->write("missing/file", "new", this->Plainly));
  EXPECT_THAT(this->list(""), Optional(ElementsAre("a")));
  EXPECT_THAT(this->list("a"), Optional(ElementsAre("file")));
  EXPECT_EQ(this->read("a/file"), "old");
}

TYPED_TEST(FilesContract, BundleIsADirectoryWhoseInformationIsEmptyUnlessItIsADictionary) {
  const auto open = [&](const std::string& name) { return this->world.bundles.open(this->root + name); };
  EXPECT_FALSE(open("a"));
  this->write("a/file");
  EXPECT_FALSE(open("a/file"));
  EXPECT_TRUE(open("a")->information().dictionary.empty());
  const std::pair<std::string, PropertyListDictionary> rows[] = {
      {"{ KTBundleIdentifier = a; b = c; }", dictionary({{"KTBundleIdentifier", "a"}, {"b", "c"}})},
      {"{ KTBundleIdentifier = (a); }", dictionary({{"KTBundleIdentifier", Array{"a"}}})},
      {"{ KTBundleIdentifier = a; b = (", {}},
      {"(a)", {}},
      {"{ KTBundleIdentifier = a; b = " + std::string(300, '(') + std::string(300, ')') + "; }", {}},
  };
  for (const auto& [text, expected] : rows) {
    this->write("a/Info.plist", text);
    const auto bundle = open("a");
    EXPECT_EQ(bundle->identifier(), bundleIdentifier(expected)) << text;
    EXPECT_EQ(bundle->information().dictionary, expected) << text;
  }
}

TYPED_TEST(FilesContract, ResourceIsAFileOfALocalizationThatHasAProperName) {
  const std::string longest(longestLocalizationName, 'l');
  const std::string good[] = {"French", longest};
  const std::string bad[] = {longest + "l", ".hidden", "b/c", "../x", ".", "", "French\0"s, "Dutch"};
  for (const std::string& name : good) this->write("a/Resources/" + name + "/r.t");
  for (const std::string& name : std::span(bad).first(5)) this->write("a/Resources/" + name + "/r.t");
  this->write("a/Resources/Dutch/r.t/file");
  const auto bundle = this->world.bundles.open(this->root + "a");
  for (const std::string& name : good)
    EXPECT_EQ(bundle->resourcePath("r", "t", name), this->root + "a/Resources/" + name + "/r.t");
  for (const std::string& name : bad) EXPECT_FALSE(bundle->resourcePath("r", "t", name)) << name;
}

TYPED_TEST(FilesContract, PublishedListIsReadAnewUnderItsDomainAndKeyOnly) {
  const std::string domain = "com.orvex.ServicesMenu.Services";
  const auto read = [&](auto... where) { return this->world.preferences.value(where...); };
  EXPECT_FALSE(read(domain, "QVServices"));
  for (const PropertyListValue& list : {PropertyListValue(Array{"a", 1}), PropertyListValue("b")}) {
    this->world.publication.publish(list);
    EXPECT_EQ(read(domain, "QVServices"), list);
  }
  EXPECT_FALSE(read(domain, "Other") || read("com.orvex.Other", "QVServices") || read("", "QVServices"));
  EXPECT_FALSE(read("../preferences/" + domain, "QVServices"));
}

TYPED_TEST(FilesContract, ApplicationsAreChosenByTheirFlagsUnderTheMask) {
  for (const char* name : {"A.app", "B.app", "Plain.app"}) this->world.install(name, name != "Plain.app"s);
  constexpr std::uint32_t services = ApplicationRegistry::providesServices;
  const auto found = [&](std::uint32_t mask, std::uint32_t value) {
    std::string initials;
    for (const auto& each : this->world.registry.applications(mask, value).applications)
      initials += each.path->at(this->root.size());
    return initials;
  };
  EXPECT_EQ(found(services, services) + found(~0U, services), "ABAB");
  EXPECT_EQ(found(0, 0) + found(~services, 0) + found(services, 0), "ABPABPP");
  EXPECT_EQ(found(0, services) + found(~0U, services | 1), "");
}

}  // namespace
}  // namespace kel::platform
