#include <fcntl.h>
#include <signal.h>
#include <sys/resource.h>
#include <thread>

#include "platform/linux/files/linux_bundles.h"
#include "platform/linux/files/runtime_directory.h"
#include "platform/linux/notifications/linux_notification_seeds.h"
#include "platform/linux/registry/linux_application_registry.h"
#include "platform/linux/scratch.h"

namespace kel::platform {
namespace {

using namespace std::string_literals;
using namespace std::chrono_literals;
using namespace testing;

TEST_F(ScratchTest, FileThatStatesNoSizeIsReadInOnePieceWhenItIsSmallAndANULDoesNotCutThePath) {
  EXPECT_THAT(readSmallFile(AT_FDCWD, "/proc/sys/kernel/pid_max"), testing::Optional(EndsWith("\n")));
  EXPECT_TRUE(files.read("/proc/self/status", 1 << 20).bytes);
  EXPECT_FALSE(files.read(scratch.write("file") + "\0x"s, 5).bytes);
}

TEST_F(ScratchTest, AtomicWriteReplacesALinkAndMakesPrivateFilesAndParents) {
  EXPECT_EQ(files.writeAtomically(scratch / "a/b/file", Bytes{'2'}), std::nullopt);
  EXPECT_EQ(scratch.mode("a") | scratch.mode("a/b"), 0700u);
  EXPECT_EQ(scratch.mode("a/b/file"), 0600u);
  symlink("a/b/file", (scratch / "link").c_str());
  EXPECT_EQ(files.writeAtomically(scratch / "link", Bytes{'3'}), std::nullopt);
  EXPECT_EQ(scratch.read("link") + scratch.read("a/b/file"), "32");
}

TEST_F(ScratchTest, FailedAtomicWriteLeavesTheOldContentsAndNoTemporaryFile) {
  scratch.write("file", "old");
  const auto before = scratch.names();
  signal(SIGXFSZ, SIG_IGN);
  rlimit unlimited{};
  getrlimit(RLIMIT_FSIZE, &unlimited);
  const rlimit full{64 * 1024, unlimited.rlim_max};  // as on a full disk
  setrlimit(RLIMIT_FSIZE, &full);
  EXPECT_EQ(files.writeAtomically(scratch / "file", Bytes(256 * 1024)), scratch / "file: File too large");
  setrlimit(RLIMIT_FSIZE, &unlimited);
  for (const std::string& name : {"file/"s, std::string(300, 'n'), "file\0x"s}) {
    EXPECT_TRUE(files.writeAtomically(scratch / name, {})) << name;
  }
  EXPECT_EQ(scratch.read("file"), "old");
  EXPECT_EQ(scratch.names(), before);
}

TEST_F(ScratchTest, APrivateDirectoryIsOneThatNobodyElseCanWriteTo) {
  const std::string path = scratch / "kel";
  const mode_t before = umask(0777);
  EXPECT_EQ(makePrivateDirectory(path).error, "");
  umask(before);
  EXPECT_EQ(scratch.mode("kel"), 0700U);
  ASSERT_EQ(symlink(path.c_str(), (scratch / "link").c_str()), 0);
  for (const std::string& wrong : {scratch / "link", scratch.write("file"), scratch / "missing/kel"})
    EXPECT_EQ(makePrivateDirectory(wrong).path, std::nullopt) << wrong;
  chmod(path.c_str(), 0720);
  EXPECT_THAT(makePrivateDirectory(path).error, EndsWith("kel: others may write to it"));
  if (geteuid() == 0 && chown(path.c_str(), 12345, 12345) == 0) {
    EXPECT_THAT(makePrivateDirectory(path).error, EndsWith("belongs to another user"));
  }
}

struct LinuxApplicationsTest : ScratchTest {
  /// The paths of the applications found, below the scratch directory.
  std::vector<std::string> found(std::uint32_t flags) {
    LinuxApplicationRegistry registry(files, log, queue, {scratch / "b/", scratch / "a/", scratch / "none/"},
                                      std::nullopt, nullptr);
    std::vector<std::string> result;
    for (const RegisteredApplication& application : registry.applications(flags, flags).applications)
      result.push_back(application.path.value().substr(scratch.path().size() + 1));
    return result;
  }

  ConcurrentQueue queue;
};

TEST_F(LinuxApplicationsTest, UnusableInformationCountsAsEmptyAndIsLoggedOnceUnlessItIsMissing) {
  for (const char* name : {"a/fifo.app", "a/device.app", "a/missing.app"}) scratch.makeDirectory(name);
  mkfifo((scratch / "a/fifo.app/Info.plist").c_str(), 0600);
  symlink("/dev/zero", (scratch / "a/device.app/Info.plist").c_str());
  scratch.write("a/malformed.app/Info.plist", "{ QVServices = (");
  truncate(scratch.write("a/huge.app/Info.plist").c_str(), largestForeignFile + 1);
  LinuxBundles bundles(files, log);
  for (const std::string name : {"missing", "fifo", "device", "malformed", "huge"}) {
    const auto bundle = bundles.open(scratch / "a/" + name + ".app");
    EXPECT_TRUE(bundle->information().dictionary.empty() && !bundle->identifier()) << name;
    const std::string line = "Cannot read the information dictionary " + scratch / "a/" + name + ".app/";
    EXPECT_THAT(log.take(),
                testing::Conditional(name == "missing", IsEmpty(), ElementsAre(StartsWith(line))));
  }
  EXPECT_EQ(found(0).size(), 5u);
  EXPECT_THAT(found(ApplicationRegistry::providesServices), IsEmpty());
}

TEST_F(LinuxApplicationsTest, RegistryHoldsTheApplicationsInPlainFoldersByRootAndPath) {
  std::string deep = "b";
  for (int level = 0; level < 40; ++level) deep += "/f";
  for (const std::string& name :
       {"a/A.app/Contents/Inner.app"s, "a/.hidden/H.app"s, "a/Plug.bundle/Inner.app"s, deep + "/Deep.app"})
    scratch.makeDirectory(name);
  for (const char* bundle : {"a/Z.app", "a/Tools/More/T.app", "a/Plug.bundle", "b/Later.app", "x/Linked.app"})
    scratch.write(std::string(bundle) + "/Info.plist", "{ QVServices = ({}); }");
  scratch.write("a/A.app/Info.plist", "{ QVServices = (); }");
  scratch.write("a/File.app");
  symlink("../x/Linked.app", (scratch / "a/Link.app").c_str());
  symlink("../x", (scratch / "a/folder").c_str());
  symlink("nowhere", (scratch / "a/Dangling.app").c_str());
  EXPECT_THAT(found(0), ElementsAre("b/Later.app", "a/A.app", "a/Link.app", "a/Tools/More/T.app", "a/Z.app"));
  EXPECT_THAT(found(ApplicationRegistry::providesServices),
              ElementsAre("b/Later.app", "a/Link.app", "a/Tools/More/T.app", "a/Z.app"));
  EXPECT_THAT(log.take(), testing::Each(StartsWith("Too many or too deep folders in ")));
}

struct LinuxNotificationSeedsTest : ScratchTest {
  LinuxNotificationSeeds seeds{scratch / "beacond", log};
  LinuxNotificationSeeds other{scratch / "beacond", log};  // stands for another process
};

TEST_F(LinuxNotificationSeedsTest, PostsOfManyThreadsAndInstancesAreAllCounted) {
  seeds.post("name");
  const auto posts = [this] { return NotificationStore{scratch / "beacond"}.read("name")->posts; };
  const auto start = posts();
  {
    std::vector<std::jthread> threads;
    for (LinuxNotificationSeeds* instance : {&seeds, &other, &seeds, &other}) {
      threads.emplace_back([instance] {
        for (int i = 0; i < 250; ++i) instance->post("name");
      });
    }
  }
  EXPECT_EQ(posts(), start + 1000);
  EXPECT_THAT(scratch.names("beacond"), ElementsAre(".lock", "name"));
}

TEST_F(LinuxNotificationSeedsTest, RecordThatIsCutOrChangedAnywhereCountsAsNeverSet) {
  const auto token = seeds.registerName("name");
  seeds.setState(token, 7);
  const std::string whole = scratch.read("beacond/name");
  const auto stateOf = [&](const std::string& contents) {
    scratch.write("beacond/name", contents);
    return seeds.state(token);
  };
  for (std::size_t length = 0; length < whole.size(); ++length) {
    EXPECT_EQ(stateOf(whole.substr(0, length)), 0u) << length;
    std::string changed = whole;
    changed[length] = static_cast<char>(changed[length] ^ 1);
    EXPECT_EQ(stateOf(changed), 0u) << length;
  }
  EXPECT_EQ(stateOf(whole + "x"), 0u);
  EXPECT_EQ(stateOf(whole), 7u);
  EXPECT_THAT(log.messages(), testing::SizeIs(1)) << "reported once";
}

TEST_F(LinuxNotificationSeedsTest, PostsAreSeenAlsoAfterDamageAndLoss) {
  SerialQueue queue("observer");
  Semaphore called;
  auto observation = seeds.observe("name", queue, [&] { called.signal(); });
  scratch.write("beacond/name", "damaged");
  other.post("name");
  EXPECT_TRUE(called.wait(20s));
  std::filesystem::remove_all(scratch / "beacond");
  // The directory is watched again once the loss was seen.
  while (!files.exists(scratch / "beacond")) queue.sync([] {});
  other.post("name");
  EXPECT_TRUE(called.wait(20s));
  queue.sync([&] { observation.reset(); });
}

TEST(NotificationFileName, NamesNeverLeaveTheDirectoryOrMeetEachOther) {
  EXPECT_EQ(notificationFileName("../a.b-c"), "%2E.%2Fa.b-c");
  EXPECT_EQ(notificationFileName("%2Elock"), "%252Elock");
}

}  // namespace
}  // namespace kel::platform
