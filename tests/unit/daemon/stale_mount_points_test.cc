// The start-up clean-up over real directories; only the mount table is made up.
#include <fcntl.h>
#include <sys/mount.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "base/log.h"
#include "base/unique_fd.h"
#include "daemon/stale_mount_points.h"
#include "fake_os.h"
#include "platform/linux/os_system.h"
#include "platform/linux/os_tree_walk.h"
#include "platform/services.h"
#include "registry/registry_model.h"
#include "test_files.h"

namespace brisvale {
namespace {

namespace fs = std::filesystem;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

// Real tree calls, a made-up mount table.
class TreeOs : public testing::FakeOs {
 public:
  int Unlink(const char* path) override { return real.Unlink(path); }
  os::DirectoryListing ReadDirectory(const char* path) override {
    os::DirectoryListing listing = real.ReadDirectory(path);
    if (listing.openError == 0) listing.closeError = closeError;
    return listing;
  }
  int RealPath(const char* path, std::string& resolved) override { return real.RealPath(path, resolved); }
  int ClearFlags(const char* path) override { return real.ClearFlags(path); }
  os::TreeWalk WalkTree(const char* root, const std::function<bool(const os::TreeNode&)>& visit) override {
    return real.WalkTree(root, visit);
  }
  int UnlinkAt(int dir, const char* name) override { return real.UnlinkAt(dir, name); }
  int RemoveDirectoryAt(int dir, const char* name) override { return real.RemoveDirectoryAt(dir, name); }
  int ClearFlagsAt(int dir, const char* name) override { return real.ClearFlagsAt(dir, name); }
  os::LinuxOs real;
  int closeError = 0;  // what closing a directory that was read answers
};

bool SetFlag(const fs::path& path, int flag) {
  const UniqueFd fd(::open(path.c_str(), O_RDONLY));
  int flags = 0;
  return fd && ::ioctl(fd.get(), FS_IOC_GETFLAGS, &flags) == 0 &&
         (flags |= flag, ::ioctl(fd.get(), FS_IOC_SETFLAGS, &flags) == 0);
}

struct StaleMountPointsTest : ::testing::Test {
  StaleMountPointsTest() {
    fs::create_directories(root);
    os.mounts = {{0, "proc", "/proc", "proc"}};  // nothing of the daemon's is mounted
  }
  ~StaleMountPointsTest() override {
    // Whatever a failing test left flagged must not outlive it.
    for (const auto& entry : fs::recursive_directory_iterator(base, fs::directory_options::skip_permission_denied)) {
      if (!entry.is_symlink()) os.real.ClearFlags(entry.path().c_str());
    }
  }

  const brisvale::testing::ScratchDir scratch;
  const fs::path base = scratch.path(), root = base / "mnt";
  TreeOs os;
  log::CaptureSink capture;
  registry::RegistryModel registry;
  ScopedServices services{Services{&registry, &os}};
};

TEST_F(StaleMountPointsTest, EmptiesTheRootButNotWhatLinksPointTo) {
  fs::create_directories(root / "stale/deeper/deepest");
  std::ofstream(root / "stale/deeper/file") << "x";
  std::ofstream(root / "plain") << "x";
  std::ofstream(base / "outside") << "precious";
  fs::create_directory_symlink(base, root / "link-out");
  fs::create_symlink(base / "outside", root / "stale/link-to-file");
  ASSERT_EQ(::mkfifo((root / "stale/fifo").c_str(), 0600), 0);
  // A name that is no text cannot be looked up, so it counts as not mounted.
  fs::create_directories(root / "stale-\xff/inner");
  const bool flagsWork = SetFlag(root / "stale/deeper/file", FS_IMMUTABLE_FL) &&
                         SetFlag(root / "plain", FS_APPEND_FL);
  RemoveStaleMountPoints(root.c_str());

  std::vector<std::string> left;
  for (const auto& entry : fs::recursive_directory_iterator(root)) left.push_back(fs::relative(entry.path(), root));
  EXPECT_THAT(left, IsEmpty());
  EXPECT_TRUE(fs::exists(base / "outside"));
  EXPECT_THAT(capture.Texts(log::Level::Default), ElementsAre("Failed to create string."));
  if (!flagsWork) GTEST_SKIP() << "this file system keeps no immutable or append-only flags";
}

TEST_F(StaleMountPointsTest, MissingRootIsSilentOtherFailuresAreLogged) {
  RemoveStaleMountPoints((base / "absent").c_str());
  EXPECT_THAT(capture.Texts(), IsEmpty());

  std::ofstream(base / "file") << "x";
  RemoveStaleMountPoints((base / "file").c_str());
  EXPECT_THAT(capture.Texts(), ElementsAre("Failed to open " + (base / "file").string() + ": 20"));
  // A root that was read, even an empty one, failed to close and not to open.
  capture.Clear();
  os.closeError = -EIO;
  RemoveStaleMountPoints(root.c_str());
  EXPECT_THAT(capture.Texts(), ElementsAre("Failed to close " + root.string() + ": 5"));
  EXPECT_EQ(RemoveTree((base / "absent").c_str(), 1), 0);  // nothing to walk is nothing to remove
}

// Each top entry is its own attack; the walk must survive all of them and touch nothing
// outside the root: a same-device bind mount of an outside directory, a directory
// swapped for a link to an outside one while the walk runs, a tree deeper than any path
// may be long, and a start that is itself a link.
TEST_F(StaleMountPointsTest, NothingOutsideTheRootIsTouched) {
  BRISVALE_REQUIRE_ROOT();
  // On a memory file system of its own: deep trees are slow to create and drop on disk.
  ASSERT_EQ(::mount("tmpfs", base.c_str(), "tmpfs", 0, nullptr), 0);
  struct Unmount {
    std::string path;
    ~Unmount() { ::umount2(path.c_str(), MNT_DETACH); }
  } unmountBase{base.string()};
  fs::create_directories(root);
  const fs::path outside = base / "outside";
  fs::create_directories(outside / "sub");
  std::ofstream(outside / "precious") << "x";
  std::ofstream(outside / "sub/precious") << "x";
  fs::create_directories(root / "binds/bind");
  ASSERT_EQ(::mount(outside.c_str(), (root / "binds/bind").c_str(), nullptr, MS_BIND, nullptr), 0);
  fs::create_directories(root / "swaps/victim/inner");
  std::ofstream(root / "swaps/victim/inner/file") << "x";
  fs::create_directories(root / "deep");
  // 10,000 nested directories, made relative to each other: no path could name them.
  UniqueFd deep(::open((root / "deep").c_str(), O_RDONLY | O_DIRECTORY));
  for (int i = 0; i < 10000 && deep; ++i) {
    ::mkdirat(deep.get(), "d", 0755);
    deep = UniqueFd(::openat(deep.get(), "d", O_RDONLY | O_DIRECTORY));
  }
  ASSERT_TRUE(deep);
  deep.Reset();
  const std::string victim = (root / "swaps/victim").string();
  os::SetTreeWalkHookForTesting([&](const std::string& path) {
    if (path != victim) return;
    fs::rename(victim, base / "moved-victim");
    fs::create_directory_symlink(outside, victim);
  });

  RemoveStaleMountPoints(root.c_str());
  os::SetTreeWalkHookForTesting(nullptr);
  EXPECT_EQ(::umount2((root / "binds/bind").c_str(), MNT_DETACH), 0) << "the bind mount was removed";

  EXPECT_TRUE(fs::exists(outside / "precious"));
  EXPECT_TRUE(fs::exists(outside / "sub/precious"));
  EXPECT_TRUE(fs::exists(base / "moved-victim/inner/file"));
  EXPECT_FALSE(fs::exists(root / "swaps"));
  EXPECT_FALSE(fs::exists(root / "deep"));
  EXPECT_THAT(capture.Texts(), ::testing::IsSupersetOf({"Failed to remove " + (root / "binds/bind").string() + ": 16",
                                                        "Failed to delete " + (root / "binds").string() + "."}));

  fs::create_directory_symlink(outside, root / "start-link");
  capture.Clear();
  EXPECT_EQ(RemoveTree((root / "start-link").c_str(), 1), -1);
  EXPECT_THAT(capture.Texts(), ElementsAre("Failed to open path(s) for traversal: 40"));
  EXPECT_TRUE(fs::exists(outside / "sub/precious"));
}

}  // namespace
}  // namespace brisvale
