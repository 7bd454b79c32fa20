#include <cstdlib>
#include <gtest/gtest.h>
#include <unistd.h>

#include "platform/linux/conduit/linux_conduit.h"

namespace kel::platform {
namespace {

TEST(LauncherSocketsTest, OnlyWhatIsMeantForThisProcessIsTakenAndTheVariablesAreRemoved) {
  const std::string self = std::to_string(getpid());
  for (const std::string& row : {self + " 2", std::string("1 2"), self + " ", self + " -1", self + " 2x",
                                 self + " 100000", self + " 99999999999", std::string(" 2")}) {
    setenv("LISTEN_PID", row.substr(0, row.find(' ')).c_str(), 1);
    setenv("LISTEN_FDS", row.substr(row.find(' ') + 1).c_str(), 1);
    EXPECT_EQ(takeLauncherSockets().count, row == self + " 2" ? 2 : 0) << row;
    EXPECT_FALSE(getenv("LISTEN_PID") || getenv("LISTEN_FDS"));
  }
}

}  // namespace
}  // namespace kel::platform
