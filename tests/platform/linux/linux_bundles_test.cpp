#include "platform/linux/linux_bundles.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include "platform/linux/linux_file_system.h"
#include "platform/linux/scratch.h"

namespace kel::platform {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;
using testing::StartsWith;

class LinuxBundlesTest : public testing::Test {
 protected:
  Scratch scratch;
  CollectedLog log;
  LinuxFileSystem files{log};
  LinuxBundles bundles{files, log};
};

TEST_F(LinuxBundlesTest, BundleIsADirectoryWhoseInformationIsReadOnce) {
  scratch.write("A.app/Info.plist", "{ KTBundleIdentifier = org.example.a; }");
  EXPECT_EQ(bundles.open(scratch / "A.app/Info.plist"), nullptr);
  EXPECT_EQ(bundles.open(scratch / "missing"), nullptr);
  const auto bundle = bundles.open(scratch / "A.app");
  ASSERT_NE(bundle, nullptr);
  EXPECT_EQ(bundle->identifier(), PropertyListValue("org.example.a"));
  scratch.write("A.app/Info.plist", "{}");
  EXPECT_EQ(bundle->informationDictionary().size(), 1u);
  EXPECT_TRUE(bundles.open(scratch / "A.app")->informationDictionary().empty());
}

TEST_F(LinuxBundlesTest, UnusableInformationCountsAsEmptyAndIsLoggedOnceUnlessItIsMissing) {
  scratch.makeDirectory("fifo");
  mkfifo((scratch / "fifo/Info.plist").c_str(), 0600);
  scratch.makeDirectory("device");
  symlink("/dev/zero", (scratch / "device/Info.plist").c_str());
  scratch.write("malformed/Info.plist", "{ key = ");
  scratch.write("array/Info.plist", "(a)");
  truncate(scratch.write("huge/Info.plist", "").c_str(), largestForeignFile + 1);
  scratch.makeDirectory("missing");
  const std::string start = "Cannot read the information dictionary " + scratch.path() + "/";
  for (const char* name : {"fifo", "device", "malformed", "array", "huge", "missing"}) {
    const auto bundle = bundles.open(scratch / name);
    EXPECT_TRUE(bundle->informationDictionary().empty()) << name;
    EXPECT_EQ(bundle->identifier(), std::nullopt) << name;
  }
  EXPECT_THAT(log.lines(), ElementsAre(StartsWith(start + "fifo/"), StartsWith(start + "device/"),
                                       StartsWith(start + "malformed/"), StartsWith(start + "array/"),
                                       StartsWith(start + "huge/")));
}

TEST_F(LinuxBundlesTest, ResourceIsARegularFileOfOneLocalization) {
  const std::string file = scratch.write("A.app/Resources/French/ServicesMenu.strings", "");
  scratch.makeDirectory("A.app/Resources/German/ServicesMenu.strings");
  const auto bundle = bundles.open(scratch / "A.app");
  EXPECT_EQ(bundle->resourcePath("ServicesMenu", "strings", "French"), file);
  for (const char* localization : {"German", "English", "..", "", "../Resources/French", "French/"}) {
    EXPECT_EQ(bundle->resourcePath("ServicesMenu", "strings", localization), std::nullopt) << localization;
  }
  EXPECT_THAT(log.lines(), IsEmpty()) << "the information dictionary was not asked for";
}

}  // namespace
}  // namespace kel::platform
