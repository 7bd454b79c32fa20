#include "platform/linux/linux_file_system.h"

#include <csignal>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include "platform/linux/scratch.h"

namespace kel::platform {
namespace {

using testing::ElementsAre;
using testing::HasSubstr;
using testing::UnorderedElementsAre;
using namespace std::string_literals;

class LinuxFileSystemTest : public testing::Test {
 protected:
  Scratch scratch;
  CollectedLog log;
  LinuxFileSystem files{log};
};

/// Lets files grow to `bytes` only, as a full disk would.
class FileSizeLimit {
 public:
  explicit FileSizeLimit(rlim_t bytes) {
    signal(SIGXFSZ, SIG_IGN);
    getrlimit(RLIMIT_FSIZE, &previous_);
    const rlimit limit{bytes, previous_.rlim_max};
    setrlimit(RLIMIT_FSIZE, &limit);
  }
  ~FileSizeLimit() { setrlimit(RLIMIT_FSIZE, &previous_); }

 private:
  rlimit previous_{};
};

TEST_F(LinuxFileSystemTest, ListingHoldsHiddenNamesAndLeavesOutThoseThatAreNotUTF8) {
  for (const char* name : {".hidden", "caf\xc3\xa9", "latin\xe9", "latin\xe8"}) scratch.write(name, "");
  EXPECT_THAT(files.listDirectory(scratch.path()).value(), UnorderedElementsAre(".hidden", "caf\xc3\xa9"));
  EXPECT_THAT(log.lines(), ElementsAre(scratch.path() + ": left out 2 name(s) that are not UTF-8"));
  EXPECT_FALSE(files.listDirectory(scratch / ".hidden")) << "not a directory";
  EXPECT_FALSE(files.listDirectory(scratch.path() + "\0/x"s)) << "a NUL must not cut the path";
}

TEST_F(LinuxFileSystemTest, ReadGivesRegularFilesUpToTheLimitAndRefusesTheRestWithoutWaiting) {
  const std::string file = scratch.write("file", "12345");
  mkfifo((scratch / "fifo").c_str(), 0600);
  symlink("file", (scratch / "link").c_str());
  EXPECT_EQ(files.read(file, 5).bytes, bytesOf("12345"));
  EXPECT_EQ(files.read(scratch / "link", 5).bytes, bytesOf("12345"));
  EXPECT_EQ(files.read(scratch.write("empty", ""), 0).bytes, Bytes());
  EXPECT_TRUE(files.read("/proc/self/status", 1 << 20).bytes) << "a file that states no size";
  const std::vector<std::pair<std::string, std::string>> refused{
      {file, "File too large"},
      {scratch / "fifo", "not a regular file"},
      {"/dev/zero", "not a regular file"},
      {scratch.path(), "Is a directory"},
      {scratch / "none", "No such file or directory"},
      {"/proc/self/status", "File too large"},
      {file + "\0x"s, "Invalid argument"}};
  for (const auto& [path, error] : refused) {
    const FileReading reading = files.read(path, 4);
    EXPECT_FALSE(reading.bytes) << path;
    EXPECT_EQ(reading.error, path + ": " + error);
  }
}

TEST_F(LinuxFileSystemTest, AtomicWriteReplacesTheFileAndMakesPrivateParents) {
  EXPECT_EQ(files.writeAtomically(scratch / "a/b/file", bytesOf("old")), std::nullopt);
  EXPECT_EQ(files.writeAtomically(scratch / "a/b/file", bytesOf("new")), std::nullopt);
  EXPECT_EQ(scratch.read("a/b/file"), "new");
  EXPECT_THAT(scratch.names("a/b"), ElementsAre("file"));
  EXPECT_EQ(scratch.mode("a"), 0700u);
  EXPECT_EQ(scratch.mode("a/b"), 0700u);
  EXPECT_EQ(scratch.mode("a/b/file"), 0600u);
}

TEST_F(LinuxFileSystemTest, AtomicWriteReplacesALinkAndNotWhatItLeadsTo) {
  scratch.write("victim", "precious");
  symlink("victim", (scratch / "link").c_str());
  EXPECT_EQ(files.writeAtomically(scratch / "link", bytesOf("new")), std::nullopt);
  EXPECT_EQ(scratch.read("victim"), "precious");
  EXPECT_EQ(scratch.read("link"), "new");
}

TEST_F(LinuxFileSystemTest, FailedAtomicWriteLeavesTheOldContentsAndNoTemporaryFile) {
  scratch.write("file", "old");
  scratch.makeDirectory("directory/inside");
  const auto before = scratch.names();
  {
    const FileSizeLimit full(64 * 1024);
    const auto error = files.writeAtomically(scratch / "file", Bytes(256 * 1024));
    EXPECT_EQ(error, scratch / "file" + ": File too large");
  }
  EXPECT_EQ(files.writeAtomically(scratch / "directory", bytesOf("x")),
            scratch / "directory" + ": Is a directory");
  EXPECT_EQ(files.writeAtomically(scratch / "file/below", bytesOf("x")),
            scratch / "file" + ": Not a directory");
  EXPECT_TRUE(files.writeAtomically(scratch / "file/", bytesOf("x")));
  EXPECT_TRUE(files.writeAtomically(scratch / std::string(300, 'n'), bytesOf("x")));
  EXPECT_TRUE(files.writeAtomically(scratch / "cut\0off"s, bytesOf("x")));
  EXPECT_EQ(scratch.read("file"), "old");
  EXPECT_EQ(scratch.names(), before);
}

TEST_F(LinuxFileSystemTest, PlainWriteTruncatesARegularFileAndTouchesNothingElse) {
  EXPECT_EQ(files.writePlainly(scratch.write("file", "a longer text"), bytesOf("short")), std::nullopt);
  EXPECT_EQ(scratch.read("file"), "short");
  EXPECT_EQ(files.writePlainly(scratch / "fresh", bytesOf("x")), std::nullopt);
  EXPECT_EQ(scratch.mode("fresh"), 0600u);
  symlink("file", (scratch / "link").c_str());
  mkfifo((scratch / "fifo").c_str(), 0600);
  for (const char* name : {"link", "fifo", ".", "none/x"}) {
    EXPECT_THAT(files.writePlainly(scratch / name, bytesOf("x")).value_or("written"), HasSubstr(": "))
        << name;
  }
  EXPECT_EQ(scratch.read("file"), "short");
}

TEST_F(LinuxFileSystemTest, RemoveAndExistsTellWhatIsThere) {
  scratch.write("file", "");
  symlink("nowhere", (scratch / "dangling").c_str());
  EXPECT_TRUE(files.exists(scratch / "file"));
  EXPECT_FALSE(files.exists(scratch / "dangling"));
  EXPECT_FALSE(files.exists(scratch / "file\0x"s));
  EXPECT_FALSE(files.remove(scratch / "file\0x"s));
  EXPECT_TRUE(files.remove(scratch / "file"));
  EXPECT_FALSE(files.remove(scratch / "file"));
}

}  // namespace
}  // namespace kel::platform
