// The start-up clean-up over real directories; only the mount table is made up.
#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "base/log.h"
#include "daemon/stale_mount_points.h"
#include "fake_os.h"
#include "platform/linux/os_system.h"
#include "platform/services.h"
#include "registry/registry_model.h"

namespace brisvale {
namespace {

namespace fs = std::filesystem;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

// Real tree calls, a made-up mount table.
class TreeOs : public testing::FakeOs {
 public:
  int Unlink(const char* path) override { return real.Unlink(path); }
  int RemoveDirectory(const char* path) override { return real.RemoveDirectory(path); }
  int ReadDirectory(const char* path, std::vector<os::DirectoryEntry>& entries) override {
    return real.ReadDirectory(path, entries);
  }
  int RealPath(const char* path, std::string& resolved) override { return real.RealPath(path, resolved); }
  int ClearFlags(const char* path) override { return real.ClearFlags(path); }
  os::TreeWalk WalkTree(const char* root, const std::function<bool(const os::TreeNode&)>& visit) override {
    return real.WalkTree(root, visit);
  }
  os::LinuxOs real;
};

bool SetFlag(const fs::path& path, int flag) {
  const int fd = ::open(path.c_str(), O_RDONLY);
  int flags = 0;
  const bool set = fd >= 0 && ::ioctl(fd, FS_IOC_GETFLAGS, &flags) == 0 &&
                   (flags |= flag, ::ioctl(fd, FS_IOC_SETFLAGS, &flags) == 0);
  if (fd >= 0) ::close(fd);
  return set;
}

class StaleMountPointsTest : public ::testing::Test {
 protected:
  StaleMountPointsTest() : services_(Services{&registry_, &os}) {
    char dir[] = "/tmp/brisvale-stale-XXXXXX";
    base = ::mkdtemp(dir);
    root = base / "mnt";
    fs::create_directories(root);
    os.mounts = {{0, "proc", "/proc", "proc"}};  // nothing of the daemon's is mounted
  }
  ~StaleMountPointsTest() override {
    // Whatever a failing test left flagged must not outlive it.
    for (const auto& entry : fs::recursive_directory_iterator(base, fs::directory_options::skip_permission_denied)) {
      if (!entry.is_symlink()) os.real.ClearFlags(entry.path().c_str());
    }
    fs::remove_all(base);
  }

  TreeOs os;
  fs::path base, root;
  log::CaptureSink capture;

 private:
  registry::RegistryModel registry_;
  ScopedServices services_;
};

TEST_F(StaleMountPointsTest, EmptiesTheRootButNotWhatLinksPointTo) {
  fs::create_directories(root / "stale/deeper/deepest");
  std::ofstream(root / "stale/deeper/file") << "x";
  std::ofstream(root / "plain") << "x";
  std::ofstream(base / "outside") << "precious";
  fs::create_directory_symlink(base, root / "link-out");
  fs::create_symlink(base / "outside", root / "stale/link-to-file");
  fs::create_symlink(root / "missing", root / "dangling");
  ASSERT_EQ(::mkfifo((root / "stale/fifo").c_str(), 0600), 0);
  const bool flagsWork = SetFlag(root / "stale/deeper/file", FS_IMMUTABLE_FL) &&
                         SetFlag(root / "plain", FS_APPEND_FL);
  RemoveStaleMountPoints(root.c_str());

  std::vector<std::string> left;
  for (const auto& entry : fs::recursive_directory_iterator(root)) left.push_back(fs::relative(entry.path(), root));
  EXPECT_THAT(left, IsEmpty());
  EXPECT_TRUE(fs::exists(base / "outside"));
  EXPECT_THAT(capture.Lines(), ::testing::Each(::testing::Field(&log::Line::level, log::Level::Debug)));
  if (!flagsWork) GTEST_SKIP() << "this file system keeps no immutable or append-only flags";
}

TEST_F(StaleMountPointsTest, MissingRootIsSilentOtherFailuresAreLogged) {
  RemoveStaleMountPoints((base / "absent").c_str());
  EXPECT_THAT(capture.Texts(), IsEmpty());

  std::ofstream(base / "file") << "x";
  RemoveStaleMountPoints((base / "file").c_str());
  EXPECT_THAT(capture.Texts(), ElementsAre("Failed to open " + (base / "file").string() + ": 20"));

  capture.Clear();
  EXPECT_EQ(RemoveTree((base / "absent").c_str(), 1), 0);  // nothing to walk is nothing to remove
  fs::create_directories(root / "keep-start/child");
  EXPECT_EQ(RemoveTree((root / "keep-start").c_str(), 0), 0);
  EXPECT_TRUE(fs::exists(root / "keep-start"));
  EXPECT_FALSE(fs::exists(root / "keep-start/child"));
}

}  // namespace
}  // namespace brisvale
