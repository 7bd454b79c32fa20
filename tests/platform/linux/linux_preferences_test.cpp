#include "platform/linux/linux_preferences.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "platform/linux/linux_file_system.h"
#include "platform/linux/linux_services_publication.h"
#include "platform/linux/scratch.h"
#include "support/print.h"

namespace kel::platform {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;
using testing::StartsWith;

constexpr const char* domain = "com.orvex.ServicesMenu.Services";
constexpr const char* stored = "state/kel/preferences/com.orvex.ServicesMenu.Services.plist";

class LinuxPreferencesTest : public testing::Test {
 protected:
  Scratch scratch;
  CollectedLog log;
  LinuxFileSystem files{log};
  LinuxPreferences preferences{files, scratch / "state", scratch / "config"};
  LinuxServicesPublication publication{files, log, scratch / "state"};
};

TEST_F(LinuxPreferencesTest, PublishedListIsReadBackAndOtherKeysStay) {
  EXPECT_EQ(preferences.value(domain, "QVServices"), std::nullopt);
  publication.publish("first");
  EXPECT_EQ(preferences.value(domain, "QVServices"), PropertyListValue("first"));
  scratch.write(stored, "{ Other = kept; QVServices = old; }");
  publication.publish("second");
  EXPECT_EQ(preferences.value(domain, "QVServices"), PropertyListValue("second"));
  EXPECT_EQ(preferences.value(domain, "Other"), PropertyListValue("kept"));
  EXPECT_THAT(log.lines(), IsEmpty());
}

TEST_F(LinuxPreferencesTest, WhatProgramsWroteComesBeforeWhatTheUserSet) {
  scratch.write("config/kel/preferences/d.plist", "{ a = user; b = user; }");
  scratch.write("state/kel/preferences/d.plist", "{ a = program; }");
  EXPECT_EQ(preferences.value("d", "a"), PropertyListValue("program"));
  EXPECT_EQ(preferences.value("d", "b"), PropertyListValue("user"));
  scratch.write("secret.plist", "{ a = 1; }");
  for (const char* name : {"../../../secret", "../secret", "", "..", "/secret", ".d"}) {
    EXPECT_EQ(preferences.value(name, "a"), std::nullopt) << name;
  }
}

TEST_F(LinuxPreferencesTest, UnreadableFileIsReplacedAndAFailureIsLogged) {
  scratch.write(stored, "{ broken");
  publication.publish("new");
  EXPECT_EQ(preferences.value(domain, "QVServices"), PropertyListValue("new"));
  std::filesystem::remove_all(scratch / "state");
  scratch.write("state", "a file");
  publication.publish("lost");
  LinuxServicesPublication(files, log, std::nullopt).publish("lost");
  EXPECT_THAT(log.lines(), ElementsAre(StartsWith("Replacing the unreadable preferences file "),
                                       "Cannot publish services: " + (scratch / "state/kel/preferences") +
                                           ": Not a directory",
                                       "Cannot publish services: there is no state directory"));
}

}  // namespace
}  // namespace kel::platform
