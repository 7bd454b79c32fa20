#include "common/common.h"
#include "entries/entry_fixture.h"

namespace kel::test {
namespace {

class CollisionTest : public EntryTest {};

TEST_F(CollisionTest, PrecedenceListHoldsEveryDirectoryOnceAtItsFirstPlace) {
  system.directories.set({.libraries = {"/home/u/Library", "/Library", "/Net/Library", "/System/Library"}});
  EXPECT_THAT(
      service_directory_precedence(system.platform),
      testing::ElementsAre("/System/Library/Services/", "/Library/Services/", "/home/u/Library/Services/",
                           "/Applications/", "/OrvexInternal/Library/Services/",
                           "/OrvexInternal/Applications/", "/Net/Library/Services/"));
  system.directories.set({.libraries = {"/Late/Library"}});
  EXPECT_THAT(service_directory_precedence(system.platform), testing::SizeIs(7)) << "built once";
}

TEST_F(CollisionTest, DirectoryThenBootVolumeThenPathLengthDecide) {
  struct Row {
    std::string winner;
    std::string loser;
    std::string reason;
    bool tie = false;  // then the receiver wins, whichever it is
  };
  const std::vector<Row> rows{
      {"/System/Library/Services/A long name.service", "/Applications/A.app", "directory precedence"},
      {"/Applications/A.app", "/home/u/Desktop/A.app", "directory precedence"},
      {"/home/u/Library/Services/A.service", "/Network/Library/Services/A.service", "directory precedence"},
      {"/Network/Library/Services/A.service", "/x/A.app", "directory precedence"},
      {"/Applications/A.app", "/applications/A.app", "directory precedence"},
      {"/Applications/A.app", "/Volumes/Disk/Applications/A.app", "directory precedence"},
      {"/home/u/Desktop/Folder/A.app", "/Volumes/D/A.app", "boot volume"},
      {"/Volumes.old/A.app", "/Volumes/A.app", "boot volume"},
      {"/Applications/A.app", "/Applications/Old/A.app", "path length"},
      {"/Volumes/D/A.app", "/Volumes/D/Old/A.app", "path length"},
      {"/x/\u00e9\u00e9.app", "/x/abc.app", "path length"},
      {"/x/\u20ac\u20ac.app", "/x/\U0001F600a.app", "path length"},
      {"/x/A.app", "/x/B.app", "path length", true},
      {"/x/\U0001F600.app", "/x/ab.app", "path length", true}};
  for (const Row& row : rows) {
    const auto winner = entryAt(row.winner);
    const auto loser = entryAt(row.loser);
    EXPECT_EQ(
        debugLines([&] { EXPECT_TRUE(winner->shouldTakePriorityOverEntry(*loser)); }),
        "Collision resolution: preferring " + row.winner + " to " + row.loser + " due to " + row.reason);
    EXPECT_EQ(loser->shouldTakePriorityOverEntry(*winner), row.tie) << row.winner << " over " << row.loser;
  }
}

}  // namespace
}  // namespace kel::test
