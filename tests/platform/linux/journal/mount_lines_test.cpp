#include "platform/linux/journal/mount_lines.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

namespace kel::platform {
namespace {

TEST(MountsAround, OnlyMountsOnTheWayAndBelowCountAndLinesThatCannotBeRead) {
  const std::vector<std::string> directories = {"/home/a/Applications", "/srv/My Apps"};
  const struct {
    const char* line;
    const char* mount;  ///< null: of no concern
  } rows[] = {
      {R"(21 1 8:1 / / rw,relatime shared:1 - ext4 /dev/sda1 rw)", "21 8:1 / /"},
      {R"(22 21 8:2 /users /home rw - ext4 /dev/sda2 rw)", "22 8:2 /users /home"},
      {R"(23 22 0:40 / /home/a/Applications rw - tmpfs tmpfs rw)", "23 0:40 / /home/a/Applications"},
      {R"(24 23 0:41 / /home/a/Applications/x/y rw - fuse x rw)", "24 0:41 / /home/a/Applications/x/y"},
      {R"(25 22 0:42 / /home/a/Applications2 rw - tmpfs tmpfs rw)", nullptr},
      {R"(26 22 0:43 / /home/a/App rw - tmpfs tmpfs rw)", nullptr},
      {R"(27 21 0:44 / /srv/My\040Apps/a\134b rw - tmpfs tmpfs rw)", R"(27 0:44 / /srv/My Apps/a\b)"},
      {R"(28 21 0:45 / /srv/My\04 rw - tmpfs tmpfs rw)", nullptr},
      {R"(29 21 0:46 / /srv\09/My rw - tmpfs tmpfs rw)", nullptr},
      {R"(30 21 0:47 /sub)", "30 0:47 /sub "},
      {R"(31)", "31   "},
      {R"()", "   "},
      {R"(32 21 0:48 / nowhere rw)", "32 0:48 / nowhere"},
  };
  for (const auto& [line, mount] : rows) {
    std::vector<std::string> expected;
    if (mount) expected.push_back(mount);
    EXPECT_EQ(mountsAround(directories, std::string(line) + "\n"), expected) << line;
  }
}

TEST(MountsAround, AMountThatCoversAnotherComesAfterItWhateverItsNumber) {
  EXPECT_THAT(mountsAround({"/srv/x"}, "40 21 8:1 / /srv rw - ext4 a rw\n39 40 8:2 / /srv rw - ext4 b rw\n"),
              testing::ElementsAre("40 8:1 / /srv", "39 8:2 / /srv"));
}

}  // namespace
}  // namespace kel::platform
