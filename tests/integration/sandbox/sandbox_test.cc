// The sandbox root: what it sets up inside, what shows outside, and its teardown.
#include "platform/linux/os_sandbox.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <functional>

#include "base/unique_fd.h"
#include "loop_mount.h"
#include "platform/linux/loop_device.h"
#include "sandbox_daemon.h"

namespace brisvale::linux_os {
namespace {

namespace fs = std::filesystem;

using brisvale::testing::MountPointsBelow;

// Runs body in a forked child (which may chroot) and returns what it reported.
std::string InChild(const std::function<std::string()>& body) {
  int fds[2];
  if (pipe(fds) != 0) return "pipe failed";
  const pid_t pid = fork();
  if (pid == 0) {
    const std::string report = body();
    _exit(write(fds[1], report.data(), report.size()) == static_cast<ssize_t>(report.size()) ? 0 : 1);
  }
  close(fds[1]);
  const std::string report = brisvale::testing::ReadUntilEnd(fds[0]);
  close(fds[0]);
  waitpid(pid, nullptr, 0);
  return report;
}

std::string Enter(const std::string& dir) {
  std::string error;
  return EnterSandboxRoot(dir, &error) ? "" : "setup: " + error;
}

class SandboxRoot : public ::testing::Test {
 protected:
  void SetUp() override { BRISVALE_REQUIRE_ROOT(); }
  void TearDown() override {
    std::string error;
    if (fs::exists(dir_ + "/" + kSandboxMarker)) {
      EXPECT_TRUE(TeardownSandboxRoot(dir_, &error)) << error;
    }
    EXPECT_TRUE(MountPointsBelow(dir_).empty());
  }
  const brisvale::testing::ScratchDir scratch_;
  const std::string dir_ = scratch_.str();
};

// A child sees a working device-like root, also after a restart, which reuses the binds.
// A loop-mounted image below it (attached without autoclear), a bind of an outside
// directory and a link out: the teardown unmounts and detaches what is below and leaves
// the rest.
TEST_F(SandboxRoot, WorksLikeADeviceRootAndTeardownClearsWhatIsInsideAndNothingElse) {
  auto probe = [&] {
    std::string failed = Enter(dir_);
    if (!failed.empty()) return failed;
    std::string error;
    for (const char* path : {"/proc/self/exe", "/sys/block", "/bin/sh"}) {
      if (access(path, X_OK) != 0) return std::string("no ") + path;
    }
    if (!CheckFilesystemLayout(&error)) return "layout: " + error;  // /var is the link to /private/var
    if (!fs::is_directory("/var/run/vexa")) return std::string("no /var/run/vexa");
    if (mkdir("/usr/brisvale-probe", 0755) == 0 || errno != EROFS) return std::string("/usr writable");
    return std::string();
  };
  EXPECT_EQ(InChild(probe), "");
  EXPECT_EQ(InChild(probe), "");  // the restart
  const auto mounts = MountPointsBelow(dir_);
  for (const char* tree : {"/proc", "/sys", "/usr"}) EXPECT_EQ(std::ranges::count(mounts, dir_ + tree), 1) << tree;
  EXPECT_EQ(mounts.size(), 3u);

  const brisvale::testing::ScratchDir content, outside;
  std::ofstream(content / "hello") << "world";
  std::string error;
  ASSERT_TRUE(brisvale::testing::MakeExt4Image(dir_ + "/private/var/tmp/image.ext4", 4, content.str(), &error))
      << error;
  std::ofstream(outside / "keep") << "x";
  ASSERT_EQ(mkdir((dir_ + "/private/var/mnt/held").c_str(), 0755), 0);
  ASSERT_EQ(mount(outside.str().c_str(), (dir_ + "/private/var/mnt/held").c_str(), nullptr, MS_BIND, nullptr), 0);
  fs::create_symlink(outside.path(), dir_ + "/private/var/link");

  const UniqueFd backing(open((dir_ + "/private/var/tmp/image.ext4").c_str(), O_RDONLY));
  loop::LoopDevice device;
  ASSERT_TRUE(backing && loop::Attach(backing.get(), {}, device) == 0);
  const std::string loop = device.name();
  ASSERT_EQ(mkdir((dir_ + "/private/var/mnt/image").c_str(), 0755), 0);
  ASSERT_EQ(mount(("/dev/" + loop).c_str(), (dir_ + "/private/var/mnt/image").c_str(), "ext4", MS_RDONLY, nullptr), 0);
  device.Release();
  EXPECT_TRUE(fs::exists(dir_ + "/private/var/mnt/image/hello"));

  ASSERT_TRUE(TeardownSandboxRoot(dir_, &error)) << error;
  EXPECT_TRUE(MountPointsBelow(dir_).empty());
  EXPECT_FALSE(fs::exists(dir_));
  EXPECT_FALSE(fs::exists("/sys/block/" + loop + "/loop/backing_file")) << "still attached";
  EXPECT_TRUE(fs::exists(outside / "keep"));
}

// A directory that cannot be a sandbox root is refused with a clear error and left alone.
TEST_F(SandboxRoot, BadDirectoriesAreRefusedClearlyAndLeftAlone) {
  const std::string file = dir_ + "/file", sub = dir_ + "/sub";
  std::ofstream(file) << "x";
  // A /var that is not the link: a clear error instead of a half-right root.
  fs::create_directories(sub + "/var");
  EXPECT_NE(InChild([&] { return Enter(sub); }).find(sub + "/var exists and is not a link"), std::string::npos);
  std::string error;
  EXPECT_FALSE(TeardownSandboxRoot("/", &error));
  EXPECT_NE(error.find("cannot be /"), std::string::npos) << error;
  EXPECT_FALSE(TeardownSandboxRoot(dir_, &error));  // never set up: no marker
  EXPECT_NE(error.find("is not a sandbox root"), std::string::npos) << error;
  EXPECT_TRUE(fs::exists(file));
  EXPECT_TRUE(TeardownSandboxRoot(dir_ + "/missing", &error)) << error;
  EXPECT_TRUE(TeardownSandboxRoot(sub, &error)) << error;
  EXPECT_FALSE(fs::exists(sub));

  // Nor is a host whose /var is not the link to /private/var.
  const std::string resolved = fs::canonical("/var");
  EXPECT_EQ(CheckFilesystemLayout(&error), resolved == "/private/var");
  EXPECT_TRUE(resolved == "/private/var" || error.find("/var resolves to " + resolved) != std::string::npos) << error;
}

}  // namespace
}  // namespace brisvale::linux_os
