// The sandbox root: what it sets up inside, what shows outside, and its teardown.
#include "platform/linux/os_sandbox.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/capability.h>
#include <linux/loop.h>
#include <sys/ioctl.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/sysmacros.h>
#include <sys/wait.h>
#include <unistd.h>

#include <climits>
#include <cstdlib>
#include <fstream>
#include <functional>
#include <sstream>

namespace brisvale::linux_os {
namespace {

std::string ReadFile(const std::string& path) {
  std::ifstream in(path);
  std::stringstream text;
  text << in.rdbuf();
  return text.str();
}

// Mount points at or below dir, one entry per mount (stacked mounts count twice).
std::vector<std::string> MountsBelow(const std::string& dir) {
  std::vector<std::string> found;
  std::istringstream table(ReadFile("/proc/self/mountinfo"));
  std::string line;
  while (std::getline(table, line)) {
    std::istringstream fields(line);
    std::string skip, mountPoint;
    fields >> skip >> skip >> skip >> skip >> mountPoint;
    if (mountPoint == dir || mountPoint.starts_with(dir + "/")) found.push_back(mountPoint);
  }
  return found;
}

size_t Count(const std::vector<std::string>& list, const std::string& item) {
  return static_cast<size_t>(std::count(list.begin(), list.end(), item));
}

// Runs body in a forked child (which may chroot) and returns what it reported.
std::string InChild(const std::function<std::string()>& body) {
  int fds[2];
  if (pipe(fds) != 0) return "pipe failed";
  pid_t pid = fork();
  if (pid == 0) {
    close(fds[0]);
    std::string report = body();
    if (write(fds[1], report.data(), report.size())) {
    }
    _exit(0);
  }
  close(fds[1]);
  std::string report;
  char buffer[512];
  ssize_t n;
  while ((n = read(fds[0], buffer, sizeof buffer)) > 0) report.append(buffer, n);
  close(fds[0]);
  int status = 0;
  waitpid(pid, &status, 0);
  return report;
}

std::string Enter(const std::string& dir) {
  std::string error;
  return EnterSandboxRoot(dir, &error) ? "" : "setup: " + error;
}

class SandboxRoot : public ::testing::Test {
 protected:
  void SetUp() override {
    if (geteuid() != 0) GTEST_SKIP() << "sandbox root tests need root (mounts, mknod, chroot)";
    char pattern[] = "/tmp/brisvale-sandbox-XXXXXX";
    ASSERT_NE(mkdtemp(pattern), nullptr);
    dir_ = pattern;
  }
  void TearDown() override {
    if (dir_.empty()) return;
    std::string error;
    if (access((dir_ + "/" + kSandboxMarker).c_str(), F_OK) == 0) {
      EXPECT_TRUE(TeardownSandboxRoot(dir_, &error)) << error;
    } else {
      EXPECT_EQ(rmdir(dir_.c_str()), 0) << "left behind in " << dir_;
    }
    EXPECT_TRUE(MountsBelow(dir_).empty());
  }
  std::string dir_;
};

TEST_F(SandboxRoot, ChildSeesAWorkingDeviceLikeRootAndRestartsReuseTheBinds) {
  auto probe = [&] {
    std::string failed = Enter(dir_);
    if (!failed.empty()) return failed;
    std::string error;
    char resolved[PATH_MAX];
    int null = open("/dev/null", O_WRONLY);
    if (null < 0 || write(null, "x", 1) != 1) return std::string("/dev/null unusable");
    unsigned char zeros[4] = {1, 1, 1, 1};
    int zero = open("/dev/zero", O_RDONLY);
    if (zero < 0 || read(zero, zeros, 4) != 4 || zeros[0] || zeros[3]) return std::string("/dev/zero");
    if (access("/proc/self/exe", F_OK) != 0) return std::string("no /proc/self");
    if (access("/sys/block", F_OK) != 0) return std::string("no /sys/block");
    if (access("/bin/sh", X_OK) != 0) return std::string("no /bin/sh through /usr");
    if (!realpath("/var", resolved) || std::string(resolved) != "/private/var") return std::string("/var");
    if (!CheckFilesystemLayout(&error)) return "layout: " + error;
    struct stat st {};
    if (stat("/var/run/vexa", &st) != 0 || !S_ISDIR(st.st_mode)) return std::string("no /var/run/vexa");
    if (mkdir("/usr/brisvale-probe", 0755) == 0 || errno != EROFS) return std::string("/usr writable");
    return std::string();
  };
  EXPECT_EQ(InChild(probe), "");
  EXPECT_EQ(InChild(probe), "");  // the restart
  auto mounts = MountsBelow(dir_);
  for (const char* tree : {"/proc", "/sys", "/usr"}) EXPECT_EQ(Count(mounts, dir_ + tree), 1u) << tree;
  EXPECT_EQ(mounts.size(), 3u);
}

TEST_F(SandboxRoot, MountsMadeInsideShowOutsideAndTeardownClearsThemAndNothingElse) {
  if (system("command -v mkfs.ext4 >/dev/null") != 0) GTEST_SKIP() << "mkfs.ext4 (e2fsprogs) missing";
  ASSERT_EQ(InChild([&] { return Enter(dir_); }), "");
  std::string content = dir_ + "-content", image = dir_ + "/private/var/tmp/image.ext4";
  ASSERT_EQ(system(("mkdir -p " + content + " && echo world > " + content + "/hello && mkfs.ext4 -q -d " +
                    content + " " + image + " 4M >/dev/null").c_str()),
            0);
  // Outside things the sandbox points at: they must survive the teardown.
  std::string outside = dir_ + "-outside";
  ASSERT_EQ(mkdir(outside.c_str(), 0755), 0);
  std::ofstream(outside + "/keep") << "kept";
  ASSERT_EQ(mkdir((dir_ + "/private/var/mnt/held").c_str(), 0755), 0);
  ASSERT_EQ(mount(outside.c_str(), (dir_ + "/private/var/mnt/held").c_str(), nullptr, MS_BIND, nullptr), 0);
  ASSERT_EQ(symlink(outside.c_str(), (dir_ + "/private/var/link").c_str()), 0);
  // A tree far deeper than a path may be long.
  int deep = open((dir_ + "/private/var/mnt").c_str(), O_RDONLY | O_DIRECTORY);
  for (int level = 0; level < 10000 && deep >= 0; ++level) {
    mkdirat(deep, "d", 0755);
    const int next = openat(deep, "d", O_RDONLY | O_DIRECTORY);
    close(deep);
    deep = next;
  }
  ASSERT_GE(deep, 0);
  close(deep);

  std::string loop = InChild([&] {
    std::string failed = Enter(dir_);
    if (!failed.empty()) return failed;
    int control = open("/dev/loop-control", O_RDWR);
    int n = control < 0 ? -1 : ioctl(control, LOOP_CTL_GET_FREE);
    if (n < 0) return std::string("no free loop device");
    std::string node = "/dev/loop" + std::to_string(n);
    unsigned major = 0, minor = 0;
    sscanf(ReadFile("/sys/block/loop" + std::to_string(n) + "/dev").c_str(), "%u:%u", &major, &minor);
    mknod(node.c_str(), S_IFBLK | 0600, makedev(major, minor));  // the free one may be new
    int device = open(node.c_str(), O_RDWR), backing = open("/var/tmp/image.ext4", O_RDONLY);
    loop_config config{};
    config.fd = static_cast<uint32_t>(backing);
    config.info.lo_flags = LO_FLAGS_READ_ONLY;
    if (device < 0 || ioctl(device, LOOP_CONFIGURE, &config) != 0) return std::string("attach failed");
    mkdir("/var/mnt/image", 0755);
    if (mount(node.c_str(), "/var/mnt/image", "ext4", MS_RDONLY | MS_NOSUID | MS_NODEV, nullptr) != 0) {
      return std::string("mount failed");
    }
    return "loop" + std::to_string(n);
  });
  ASSERT_TRUE(loop.starts_with("loop")) << loop;
  EXPECT_EQ(ReadFile(dir_ + "/private/var/mnt/image/hello"), "world\n");
  EXPECT_EQ(Count(MountsBelow(dir_), dir_ + "/private/var/mnt/image"), 1u);

  std::string error;
  ASSERT_TRUE(TeardownSandboxRoot(dir_, &error)) << error;
  EXPECT_TRUE(MountsBelow(dir_).empty());
  EXPECT_NE(access(dir_.c_str(), F_OK), 0);
  EXPECT_NE(access(("/sys/block/" + loop + "/loop/backing_file").c_str(), F_OK), 0) << "still attached";
  EXPECT_EQ(ReadFile(outside + "/keep"), "kept");
  EXPECT_EQ(access("/usr/bin/sh", X_OK), 0);
  EXPECT_TRUE(TeardownSandboxRoot(dir_, &error)) << "a second teardown finds nothing to do";
  system(("rm -rf " + content + " " + outside).c_str());
  dir_.clear();
}

TEST_F(SandboxRoot, BadDirectoriesAreRefusedClearlyAndLeftAlone) {
  std::string file = dir_ + "/file";
  std::ofstream(file) << "x";
  std::string error;
  struct Case {
    std::string dir;
    std::string expected;
  };
  for (const Case& c : std::vector<Case>{{dir_ + "/missing", "No such file or directory"},
                                         {file, "is not a directory"},
                                         {"", "no sandbox root"}}) {
    EXPECT_NE(InChild([&] { return Enter(c.dir); }).find(c.expected), std::string::npos) << c.dir;
  }
  EXPECT_FALSE(TeardownSandboxRoot("/", &error));
  EXPECT_NE(error.find("cannot be /"), std::string::npos) << error;
  EXPECT_FALSE(TeardownSandboxRoot(dir_, &error));  // never set up: no marker
  EXPECT_NE(error.find("is not a sandbox root"), std::string::npos) << error;
  EXPECT_EQ(ReadFile(file), "x");
  EXPECT_TRUE(TeardownSandboxRoot(dir_ + "/missing", &error)) << error;

  // A /var that is not the link: a clear error instead of a half-right root.
  std::string sub = dir_ + "/sub";
  ASSERT_EQ(mkdir(sub.c_str(), 0755), 0);
  ASSERT_EQ(mkdir((sub + "/var").c_str(), 0755), 0);
  EXPECT_NE(InChild([&] { return Enter(sub); }).find(sub + "/var exists and is not a link"), std::string::npos);
  EXPECT_TRUE(TeardownSandboxRoot(sub, &error)) << error;
  unlink(file.c_str());
}

TEST_F(SandboxRoot, WithoutPrivilegesNothingIsCreated) {
  std::string report = InChild([&] {
    __user_cap_header_struct header{_LINUX_CAPABILITY_VERSION_3, 0};
    __user_cap_data_struct data[2]{};
    syscall(SYS_capget, &header, data);
    data[CAP_MKNOD / 32].effective &= ~(1u << (CAP_MKNOD % 32));
    if (syscall(SYS_capset, &header, data) != 0) return std::string("capset failed");
    return Enter(dir_);
  });
  EXPECT_NE(report.find("needs root"), std::string::npos) << report;
  EXPECT_EQ(ReadFile("/proc/self/mountinfo").find(dir_), std::string::npos);
  EXPECT_EQ(rmdir(dir_.c_str()), 0) << "the directory should still be empty";
  dir_.clear();
}

TEST(FilesystemLayout, HostWithoutPrivateVarIsRefused) {
  char resolved[PATH_MAX];
  ASSERT_NE(realpath("/var", resolved), nullptr);
  std::string error;
  EXPECT_EQ(CheckFilesystemLayout(&error), std::string(resolved) == "/private/var");
  if (std::string(resolved) != "/private/var") {
    EXPECT_NE(error.find("/var resolves to " + std::string(resolved)), std::string::npos) << error;
  }
}

}  // namespace
}  // namespace brisvale::linux_os
