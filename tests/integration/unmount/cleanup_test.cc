// The start-up clean-up in a sandbox root: stale trees in each of the daemon's mount
// roots go, a live mount and everything outside the roots stay. (Links, flags, special
// files and mounts inside stale trees are the clean-up's unit test.)
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "loop_mount.h"
#include "sandbox_daemon.h"

namespace brisvale::testing {
namespace {

namespace fs = std::filesystem;

TEST(StartupCleanup, StaleTreesGoLiveMountsAndOutsidersStay) {
  BRISVALE_REQUIRE_ROOT();
  SandboxDaemon daemon;
  const std::string mnt = daemon.Path("/private/var/mnt");
  for (const char* root : {"/private/var/mnt", "/private/var/factory_mount", "/private/var/personalized_factory"}) {
    fs::create_directories(daemon.Path(root) + "/stale/a");
    std::ofstream(daemon.Path(root) + "/stale/a/file") << "x";
  }
  std::ofstream(daemon.Path("/precious")) << "outside every root";
  std::string error;
  ASSERT_TRUE(MakeExt4Image(daemon.Path("/live.img"), 2, "", &error)) << error;
  fs::create_directories(mnt + "/live");
  fs::create_directories(daemon.Path("/dev"));
  auto live = LoopMount::Create(daemon.Path("/live.img"), mnt + "/live", daemon.Path("/dev"), false, &error);
  ASSERT_TRUE(live) << error;
  std::ofstream(mnt + "/live/data") << "live";

  ASSERT_TRUE(daemon.Start());

  auto tree = [&](const char* root) {
    std::vector<std::string> paths;
    for (const auto& entry : fs::recursive_directory_iterator(daemon.Path(root))) {
      paths.push_back(fs::relative(entry.path(), daemon.Path(root)));
    }
    return paths;
  };
  EXPECT_THAT(tree("/private/var/mnt"), ::testing::UnorderedElementsAre("live", "live/data", "live/lost+found"));
  EXPECT_THAT(tree("/private/var/factory_mount"), ::testing::IsEmpty());
  EXPECT_THAT(tree("/private/var/personalized_factory"), ::testing::IsEmpty());
  EXPECT_TRUE(fs::exists(daemon.Path("/precious")));
  EXPECT_TRUE(daemon.LogContains("debug: Skipping destruction of mounted filesystem /private/var/mnt/live."));
}

}  // namespace
}  // namespace brisvale::testing
