#include "platform/linux/linux_standard_directories.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <map>
#include <sys/stat.h>
#include <unistd.h>

#include "platform/linux/scratch.h"

namespace kel::platform {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;
using testing::StartsWith;

class Variables final : public SystemFacts {
 public:
  std::map<std::string, std::string> values;

  std::optional<std::string> environmentVariable(const std::string& name) override {
    const auto found = values.find(name);
    return found == values.end() ? std::nullopt : std::optional(found->second);
  }
  std::string buildVersion() override { return {}; }
  SystemReading bootTime() override { return {}; }
  SystemReading auditSession() override { return {}; }
  std::uint32_t realUserID() override { return 0; }
  std::uint32_t random32() override { return 0; }
};

class LinuxStandardDirectoriesTest : public testing::Test {
 protected:
  LinuxStandardDirectoriesTest() { facts.values["HOME"] = scratch.path() + "/"; }

  Scratch scratch;
  Variables facts;
  LinuxStandardDirectories directories{facts, scratch.path()};
};

TEST_F(LinuxStandardDirectoriesTest, DirectoriesFollowHomeAndTheAbsoluteVariables) {
  EXPECT_EQ(directories.homeDirectory(), scratch.path());
  EXPECT_THAT(directories.libraryDirectories(),
              ElementsAre(scratch / "Library", "/Library", "/Network/Library", "/System/Library"));
  EXPECT_THAT(directories.systemLibraryDirectories(), ElementsAre("/System/Library"));
  facts.values["XDG_CACHE_HOME"] = "relative";
  facts.values["XDG_STATE_HOME"] = "";
  EXPECT_THAT(directories.cachesDirectories(), ElementsAre(scratch / ".cache"));
  EXPECT_EQ(directories.stateDirectory(), scratch / ".local/state");
  facts.values["XDG_CACHE_HOME"] = scratch / "caches/";
  facts.values["XDG_STATE_HOME"] = scratch / "state";
  EXPECT_THAT(directories.cachesDirectories(), ElementsAre(scratch / "caches"));
  EXPECT_EQ(directories.stateDirectory(), scratch / "state");
  EXPECT_THAT(scratch.names(), IsEmpty()) << "asking makes nothing";
  facts.values["HOME"] = "not/absolute";
  EXPECT_THAT(directories.homeDirectory(), StartsWith("/"));
}

TEST_F(LinuxStandardDirectoriesTest, DirectoryOfSomeoneElseOrAFileInItsPlaceIsRefused) {
  scratch.write("file", "");
  facts.values["XDG_STATE_HOME"] = scratch / "file";
  EXPECT_EQ(directories.stateDirectory(), std::nullopt);
  if (geteuid() != 0) GTEST_SKIP() << "only root can give a directory away";
  ASSERT_EQ(chown(scratch.makeDirectory(".cache").c_str(), 65534, 65534), 0);
  EXPECT_THAT(directories.cachesDirectories(), IsEmpty());
}

TEST_F(LinuxStandardDirectoriesTest, TemporaryDirectoryIsTheUsersOwnOrAPrivateOne) {
  const std::string own = scratch.makeDirectory("own");
  facts.values["TMPDIR"] = own;
  EXPECT_EQ(directories.temporaryDirectory(), own);
  chmod(own.c_str(), 01777);
  EXPECT_EQ(directories.temporaryDirectory(), own) << "sticky";
  EXPECT_THAT(scratch.names(), ElementsAre("own")) << "no private directory is needed";
  for (const std::string& refused :
       {own, scratch.write("file", ""), scratch / "missing", std::string("own")}) {
    chmod(own.c_str(), 0777);
    facts.values["TMPDIR"] = refused;
    EXPECT_EQ(directories.temporaryDirectory(), scratch / "tmp") << refused;
  }
  EXPECT_EQ(scratch.mode("tmp"), 0700u);
}

TEST_F(LinuxStandardDirectoriesTest, UnsafePrivateTemporaryDirectoryIsMadeSafeOrRefused) {
  facts.values.erase("TMPDIR");
  chmod(scratch.makeDirectory("tmp").c_str(), 0777);
  EXPECT_EQ(directories.temporaryDirectory(), scratch / "tmp");
  EXPECT_EQ(scratch.mode("tmp"), 0700u) << "closed to others";
  rmdir((scratch / "tmp").c_str());
  symlink(scratch.makeDirectory("elsewhere").c_str(), (scratch / "tmp").c_str());
  EXPECT_EQ(directories.temporaryDirectory(), std::nullopt) << "a symbolic link is not followed";
  EXPECT_EQ(LinuxStandardDirectories(facts, std::nullopt).temporaryDirectory(), std::nullopt);
}

}  // namespace
}  // namespace kel::platform
