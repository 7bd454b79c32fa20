#include "platform/linux/linux_system_facts.h"

#include <cerrno>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdlib.h>

#include "platform/linux/scratch.h"

namespace kel::platform {
namespace {

class LinuxSystemFactsTest : public testing::Test {
 protected:
  Scratch scratch;
  LinuxSystemFacts facts{scratch.path()};
};

TEST_F(LinuxSystemFactsTest, BuildVersionNamesTheSystemAsFarAsItIsKnownAndTheProgram) {
  struct Row {
    std::string release;
    std::string version;
  };
  const Row rows[] = {
      {"NAME=x\nID=debian\nVERSION_ID=\"12\"\n", "debian 12"},
      {"# ID=no\n ID='my os'  \nBUILD_ID=\"2 \\\"b\\\"\"\nIMAGE_VERSION=9", "my os 2 \"b\""},
      {"VERSION_ID=1\nIMAGE_VERSION=9\nID=a\nID=b", "b 1 9"},
      {"ID=\"\"\nVERSION_ID=\nBUILD_ID=\xff\xfe\n=\n\n=x", "<unknown version>"},
      {std::string(100'000, 'x'), "<unknown version>"},
  };
  const std::string program = " (kel " KEL_VERSION ", cache format 1)";
  EXPECT_EQ(facts.buildVersion(), "<unknown version>" + program);
  scratch.write("usr/lib/os-release", "ID=fallback");
  EXPECT_EQ(facts.buildVersion(), "fallback" + program);
  std::filesystem::remove_all(scratch / "usr");
  for (const Row& row : rows) {
    scratch.write("etc/os-release", row.release);
    EXPECT_EQ(facts.buildVersion(), row.version + program);
  }
}

TEST_F(LinuxSystemFactsTest, BootTimeDependsOnTheBootIdentifierAloneAndIsPositive) {
  const SystemReading failed = facts.bootTime();
  EXPECT_EQ(failed.value, std::nullopt);
  EXPECT_EQ(failed.errorNumber, ENOENT);
  EXPECT_EQ(failed.errorText, "No such file or directory");
  scratch.write("proc/sys/kernel/random/boot_id", "e36ab4d3-e74f-4d39-bbac-000f4de96271\n");
  const auto first = facts.bootTime().value;
  ASSERT_TRUE(first);
  EXPECT_GT(*first, 0);
  EXPECT_EQ(LinuxSystemFacts(scratch.path()).bootTime().value, first);
  scratch.write("proc/sys/kernel/random/boot_id", "e36ab4d3-e74f-4d39-bbac-000f4de96272\n");
  EXPECT_NE(facts.bootTime().value, first);
  scratch.write("proc/sys/kernel/random/boot_id", "\n");
  EXPECT_EQ(facts.bootTime().errorNumber, ENODATA);
}

TEST_F(LinuxSystemFactsTest, AuditSessionIsTheUnsignedTextAsASignedNumber) {
  const std::vector<std::pair<std::string, std::optional<std::int64_t>>> rows{{"7", 7},
                                                                              {"4294967295\n", -1},
                                                                              {"2147483648", -2147483648LL},
                                                                              {"4294967296", {}},
                                                                              {"-1", {}},
                                                                              {"7x", {}},
                                                                              {"", {}}};
  EXPECT_EQ(facts.auditSession().errorNumber, ENOENT);
  for (const auto& [text, value] : rows) {
    scratch.write("proc/self/sessionid", text);
    EXPECT_EQ(facts.auditSession().value, value) << text;
    EXPECT_EQ(facts.auditSession().errorNumber, value ? 0 : EINVAL) << text;
  }
}

TEST(LinuxSystemFacts, EnvironmentIsTheOneOfTheBeginning) {
  setenv("KEL_TEST_VARIABLE", "a=b", 1);
  LinuxSystemFacts facts;
  unsetenv("KEL_TEST_VARIABLE");
  EXPECT_EQ(facts.environmentVariable("KEL_TEST_VARIABLE"), "a=b");
  EXPECT_EQ(LinuxSystemFacts().environmentVariable("KEL_TEST_VARIABLE"), std::nullopt);
}

}  // namespace
}  // namespace kel::platform
