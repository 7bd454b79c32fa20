#include "platform/linux/linux_application_registry.h"

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
using testing::SizeIs;

constexpr auto flag = ApplicationRegistry::providesServices;

class LinuxApplicationRegistryTest : public testing::Test {
 protected:
  /// The paths of the applications found, below the scratch directory.
  std::vector<std::string> found(std::uint32_t mask = 0, std::uint32_t value = 0) {
    LinuxApplicationRegistry registry(files, log, queue, {scratch / "b/", scratch / "a/", scratch / "none/"});
    std::vector<std::string> result;
    for (const RegisteredApplication& application : registry.applications(mask, value)) {
      result.push_back(application.path.value().substr(scratch.path().size() + 1));
    }
    return result;
  }

  Scratch scratch;
  CollectedLog log;
  LinuxFileSystem files{log};
  ConcurrentQueue queue;
};

TEST_F(LinuxApplicationRegistryTest, ApplicationsComeInTheOrderOfRootsAndPathsFromPlainFoldersOnly) {
  for (const char* directory : {"a/Z.app", "a/A.app/Contents/Inner.app", "a/Tools/More/Deep.app",
                                "a/.hidden/H.app", "a/.app", "a/Plug.bundle/Inner.app", "b/Later.app",
                                "a/x.APP", "elsewhere/Linked.app", "elsewhere/folder/No.app"}) {
    scratch.makeDirectory(directory);
  }
  scratch.write("a/File.app", "");
  scratch.write("a/Plug.bundle/Info.plist", "{}");
  symlink((scratch / "elsewhere/Linked.app").c_str(), (scratch / "a/Link.app").c_str());
  symlink((scratch / "elsewhere/folder").c_str(), (scratch / "a/folder").c_str());
  symlink("..", (scratch / "a/Tools/loop").c_str());
  symlink("nowhere", (scratch / "a/Dangling.app").c_str());
  EXPECT_THAT(found(),
              ElementsAre("b/Later.app", "a/A.app", "a/Link.app", "a/Tools/More/Deep.app", "a/Z.app"));
  EXPECT_THAT(log.lines(), IsEmpty());
}

TEST_F(LinuxApplicationRegistryTest, FlagMarksApplicationsThatDeclareServices) {
  scratch.write("a/Some.app/Info.plist", "{ QVServices = ({}); }");
  scratch.write("a/Empty.app/Info.plist", "{ QVServices = (); }");
  scratch.write("a/Kind.app/Info.plist", "{ QVServices = text; }");
  scratch.write("a/Broken.app/Info.plist", "{ QVServices = (");
  scratch.makeDirectory("a/None.app");
  scratch.makeDirectory("a/Fifo.app");
  mkfifo((scratch / "a/Fifo.app/Info.plist").c_str(), 0600);
  EXPECT_THAT(found(flag, flag), ElementsAre("a/Some.app"));
  EXPECT_THAT(found(flag, 0), SizeIs(5));
}

TEST_F(LinuxApplicationRegistryTest, FoldersNestedTooDeeplyAreLeftOutWithALogLine) {
  std::string folder = "a";
  for (int level = 0; level < 40; ++level) folder += "/f";
  scratch.makeDirectory(folder + "/Deep.app");
  scratch.makeDirectory("a/Near.app");
  EXPECT_THAT(found(), ElementsAre("a/Near.app"));
  EXPECT_THAT(log.lines(), SizeIs(1));
}

TEST(LinuxApplicationRegistry, ApplicationDirectoriesEndWithTheUsersOwn) {
  EXPECT_THAT(LinuxApplicationRegistry::applicationDirectories("/home/u"),
              ElementsAre("/System/Applications/", "/Network/Applications/", "/Applications/",
                          "/home/u/Applications/"));
}

}  // namespace
}  // namespace kel::platform
