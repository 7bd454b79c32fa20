#include "platform/linux/linux_platform.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdlib.h>

#include "platform/linux/scratch.h"
#include "support/print.h"

namespace kel::platform {
namespace {

using testing::ElementsAre;
using testing::HasSubstr;
using testing::UnorderedElementsAre;

class LinuxPlatformTest : public testing::Test {
 protected:
  LinuxPlatformTest() {
    scratch.makeDirectory("run");
    set("HOME", scratch / "home");
    set("XDG_RUNTIME_DIR", scratch / "run");
    for (const char* name :
         {"XDG_CACHE_HOME", "XDG_STATE_HOME", "XDG_CONFIG_HOME", "TMPDIR", "NOTIFY_SOCKET"}) {
      set(name, "");
    }
  }

  ~LinuxPlatformTest() override {
    for (const auto& [name, value] : previous_) {
      if (value) {
        setenv(name.c_str(), value->c_str(), 1);
      } else {
        unsetenv(name.c_str());
      }
    }
  }

  void set(const std::string& name, const std::string& value) {
    const char* previous = getenv(name.c_str());
    previous_.emplace_back(name, previous ? std::optional<std::string>(previous) : std::nullopt);
    setenv(name.c_str(), value.c_str(), 1);
  }

  Scratch scratch;

 private:
  std::vector<std::pair<std::string, std::optional<std::string>>> previous_;
};

TEST_F(LinuxPlatformTest, AWholeAgentRunsInAScratchHome) {
  LinuxPlatform linuxPlatform;
  Platform& platform = linuxPlatform.platform();
  platform.publication.publish("published");
  EXPECT_EQ(platform.preferences.value("com.orvex.ServicesMenu.Services", "QVServices"),
            PropertyListValue("published"));
  const auto token = platform.seeds.registerName("seed");
  platform.seeds.setState(token, 5);
  EXPECT_EQ(platform.seeds.state(token), 5u);
  EXPECT_EQ(platform.directories.temporaryDirectory(), scratch / "run/kel/tmp");
  std::filesystem::create_directories(scratch / "home/Applications/A.app");
  std::vector<std::string> applications;
  for (const auto& application : platform.applications.applications(0, 0))
    applications.push_back(*application.path);
  EXPECT_THAT(applications, testing::Contains(scratch / "home/Applications/A.app"));
  EXPECT_THAT(scratch.names("home"), UnorderedElementsAre(".local", "Applications"));
  EXPECT_THAT(scratch.names("run"), ElementsAre("kel"));
}

TEST_F(LinuxPlatformTest, WithoutARuntimeDirectoryTheProgramStartsAndSaysSo) {
  set("XDG_RUNTIME_DIR", scratch.write("file", ""));
  testing::internal::CaptureStderr();
  LinuxPlatform linuxPlatform;
  Platform& platform = linuxPlatform.platform();
  platform.seeds.post("name");
  EXPECT_EQ(platform.seeds.state(platform.seeds.registerName("name")), 0u);
  SerialQueue queue("endpoint");
  EXPECT_EQ(platform.conduit.listen("endpoint", queue, [](const ConduitEvent&) {}).listener, nullptr);
  EXPECT_EQ(platform.directories.temporaryDirectory(), std::nullopt);
  const std::string printed = testing::internal::GetCapturedStderr();
  if (std::filesystem::exists("/dev/log")) GTEST_SKIP() << "the lines went to the system log";
  EXPECT_THAT(printed, HasSubstr("No runtime directory: "));
}

}  // namespace
}  // namespace kel::platform
