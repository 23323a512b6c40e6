// The start-up clean-up in a sandbox root: stale trees go, live mounts and everything
// outside the roots stay, and no walk enters a file system mounted inside a stale tree.
#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "base/unique_fd.h"
#include "loop_mount.h"
#include "sandbox_daemon.h"

namespace brisvale::testing {
namespace {

namespace fs = std::filesystem;
using ::testing::UnorderedElementsAre;

void SetFlag(const std::string& path, int flag) {
  const UniqueFd fd(::open(path.c_str(), O_RDONLY));
  int flags = 0;
  ASSERT_TRUE(fd && ::ioctl(fd.get(), FS_IOC_GETFLAGS, &flags) == 0);
  flags |= flag;
  ASSERT_EQ(::ioctl(fd.get(), FS_IOC_SETFLAGS, &flags), 0) << path;
}

std::vector<std::string> Tree(const std::string& root) {
  std::vector<std::string> paths;
  for (const auto& entry : fs::recursive_directory_iterator(root)) paths.push_back(fs::relative(entry.path(), root));
  return paths;
}

TEST(StartupCleanup, StaleTreesGoLiveMountsAndOutsidersStay) {
  BRISVALE_REQUIRE_ROOT();
  SandboxDaemon daemon;
  const std::string mnt = daemon.Path("/private/var/mnt");
  const std::string factory = daemon.Path("/private/var/factory_mount");
  const std::string personalized = daemon.Path("/private/var/personalized_factory");
  for (const std::string& dir : {mnt + "/live", mnt + "/stale/a/b", factory + "/holder/deep/mount",
                                 personalized + "/empty"}) {
    fs::create_directories(dir);
  }
  std::ofstream(mnt + "/stale/a/b/file") << "x";
  std::ofstream(mnt + "/stale/immutable") << "x";
  std::ofstream(personalized + "/append-only") << "x";
  std::ofstream(daemon.Path("/precious")) << "outside every root";
  fs::create_symlink(daemon.Path("/precious"), mnt + "/link-out");
  fs::create_directory_symlink(daemon.Path("/private"), factory + "/dir-link-out");
  fs::create_symlink(mnt + "/nothing", personalized + "/dangling");
  ASSERT_EQ(::mkfifo((mnt + "/stale/fifo").c_str(), 0600), 0);
  SetFlag(mnt + "/stale/immutable", FS_IMMUTABLE_FL);
  SetFlag(personalized + "/append-only", FS_APPEND_FL);

  std::string error;
  for (const char* name : {"/live.img", "/deep.img"}) {
    ASSERT_TRUE(MakeExt4Image(daemon.Path(name), 2, "", &error)) << error;
  }
  fs::create_directories(daemon.Path("/dev"));
  auto live = LoopMount::Create(daemon.Path("/live.img"), mnt + "/live", daemon.Path("/dev"), false, &error);
  ASSERT_TRUE(live) << error;
  std::ofstream(mnt + "/live/data") << "live";
  auto deep = LoopMount::Create(daemon.Path("/deep.img"), factory + "/holder/deep/mount", daemon.Path("/dev"),
                                false, &error);
  ASSERT_TRUE(deep) << error;
  std::ofstream(factory + "/holder/deep/mount/data") << "mounted deep inside";

  ASSERT_TRUE(daemon.Start());

  EXPECT_THAT(Tree(mnt), UnorderedElementsAre("live", "live/data", "live/lost+found"));
  EXPECT_THAT(Tree(factory), UnorderedElementsAre("holder", "holder/deep", "holder/deep/mount",
                                                  "holder/deep/mount/data", "holder/deep/mount/lost+found"));
  EXPECT_THAT(Tree(personalized), ::testing::IsEmpty());
  EXPECT_TRUE(fs::exists(daemon.Path("/precious")));
  EXPECT_TRUE(fs::exists(daemon.Path("/private/var/run")));
  EXPECT_TRUE(daemon.LogContains("debug: Skipping destruction of mounted filesystem /private/var/mnt/live."));
  EXPECT_TRUE(daemon.LogContains("default: Failed to remove /private/var/factory_mount/holder/deep/mount: 16"));
  EXPECT_TRUE(daemon.LogContains("default: Failed to delete /private/var/factory_mount/holder."));
}

TEST(StartupCleanup, MissingRootsAreSilent) {
  BRISVALE_REQUIRE_ROOT();
  SandboxDaemon daemon;
  ASSERT_TRUE(daemon.Start());
  for (const std::string& line : daemon.LogLines()) EXPECT_THAT(line, ::testing::Not(::testing::HasSubstr("Failed")));
}

}  // namespace
}  // namespace brisvale::testing
