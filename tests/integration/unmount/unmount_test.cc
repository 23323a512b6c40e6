// "Unmount" and "Sync" against real loop-mounted images in a sandbox root. (Unknown
// paths are the handlers' unit test.)
#include <fcntl.h>
#include <sys/mount.h>
#include <unistd.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <fstream>

#include "base/unique_fd.h"
#include "loop_mount.h"
#include "platform/linux/notify_center.h"
#include "platform/linux/os_system.h"
#include "plist_printers.h"
#include "sandbox_daemon.h"

namespace brisvale::testing {
namespace {

namespace fs = std::filesystem;

const plist::Value kFailure = plist::Dictionary{{"Status", "Failure"}};
const plist::Value kSuccess = plist::Dictionary{{"Status", "Success"}};

bool IsMountPoint(const std::string& path) {
  std::vector<os::MountRecord> table;
  EXPECT_GE(os::ReadWholeMountTable("/proc/self/mountinfo", table), 0);
  return std::ranges::any_of(table, [&](const os::MountRecord& mount) { return mount.mountedOn == path; });
}

struct UnmountTest : ::testing::Test {
  void SetUp() override {
    BRISVALE_REQUIRE_ROOT();
    ASSERT_TRUE(daemon.Start());
    std::string error;
    subscriber = notify::Subscriber::Create(daemon.Path("/private/var/run/vexa/notify"), &error);
    ASSERT_TRUE(subscriber) << error;
  }

  std::unique_ptr<LoopMount> MountImage(const std::string& inside) {
    fs::create_directories(daemon.Path(inside));
    const std::string image = daemon.Path("/image-" + std::to_string(images++) + ".img");
    std::string error;
    EXPECT_TRUE(MakeExt4Image(image, 2, "", &error)) << error;
    auto mount = LoopMount::Create(image, daemon.Path(inside), daemon.Path("/dev"), false, &error);
    EXPECT_TRUE(mount) << error;
    return mount;
  }

  plist::Value Request(const char* type, const std::string& mountPath) {
    std::optional<plist::Value> reply;
    EXPECT_TRUE(daemon.SendRequest(plist::Dictionary{{"RequestType", type}, {"MountPath", plist::Value(mountPath)}},
                                   &reply).ok());
    return reply.value_or(plist::Value());
  }

  // The names of the notifications that arrived within a short while.
  std::vector<std::string> Received() {
    std::vector<std::string> names;
    while (auto notification = subscriber->Receive(std::chrono::milliseconds(300))) {
      names.push_back(notification->name);
    }
    return names;
  }

  SandboxDaemon daemon;
  std::unique_ptr<notify::Subscriber> subscriber;
  int images = 0;
};

TEST_F(UnmountTest, SyncFlushesAndUnmountKeepsTheDeveloperDirectoryButRemovesOthers) {
  auto developer = MountImage("/Developer");
  auto media = MountImage("/private/var/mnt/media1");
  ASSERT_TRUE(developer && media);

  std::ofstream(daemon.Path("/private/var/mnt/media1/data")) << "to be flushed";
  EXPECT_EQ(Request("Sync", "/private/var/mnt/media1"), kSuccess);
  EXPECT_EQ(Request("Unmount", "/Developer"), kSuccess);
  EXPECT_TRUE(fs::is_directory(daemon.Path("/Developer")));
  EXPECT_FALSE(IsMountPoint(daemon.Path("/Developer")));

  EXPECT_EQ(Request("Unmount", "/private/var/mnt/media1"), kSuccess);
  EXPECT_FALSE(fs::exists(daemon.Path("/private/var/mnt/media1")));
  EXPECT_THAT(Received(), ::testing::ElementsAre("com.vantrel.brisvale_unmounted", "com.vantrel.brisvale_unmounted"));
}

TEST_F(UnmountTest, BusyVolumeGoesAndAFileUnderTheMountKeepsTheDirectory) {
  fs::create_directories(daemon.Path("/private/var/mnt/media2"));
  std::ofstream(daemon.Path("/private/var/mnt/media2/hidden")) << "under the mount";
  auto media = MountImage("/private/var/mnt/media2");
  ASSERT_TRUE(media);
  const UniqueFd held(::open(daemon.Path("/private/var/mnt/media2/lost+found").c_str(), O_RDONLY | O_DIRECTORY));
  ASSERT_TRUE(held);

  EXPECT_EQ(Request("Unmount", "/private/var/mnt/media2"), kFailure);
  EXPECT_FALSE(IsMountPoint(daemon.Path("/private/var/mnt/media2")));
  EXPECT_TRUE(fs::exists(daemon.Path("/private/var/mnt/media2/hidden")));
  EXPECT_TRUE(daemon.LogContains("default: Failed to remove /private/var/mnt/media2: Directory not empty"));
  EXPECT_THAT(Received(), ::testing::IsEmpty());
}

// A memory file system mounted with a loop device's name as its source: the device
// holds nothing of it and stays attached; the unmount itself still succeeds.
TEST_F(UnmountTest, OnlyTheDeviceHoldingTheMountIsEjected) {
  auto held = MountImage("/private/var/mnt/held");
  ASSERT_TRUE(held);
  const std::string loopName = held->device().substr(5);
  fs::create_directories(daemon.Path("/private/var/mnt/media3"));
  ASSERT_EQ(::mount(held->device().c_str(), daemon.Path("/private/var/mnt/media3").c_str(), "tmpfs", 0, nullptr), 0);

  EXPECT_EQ(Request("Unmount", "/private/var/mnt/media3"), kSuccess);
  EXPECT_TRUE(daemon.LogContains("default: Failed to eject " + held->device() + " : 19"));
  EXPECT_THAT(Received(), ::testing::ElementsAre("com.vantrel.brisvale_unmounted"));
  EXPECT_TRUE(fs::exists("/sys/block/" + loopName + "/loop/backing_file")) << "detached";
  EXPECT_TRUE(IsMountPoint(daemon.Path("/private/var/mnt/held")));
}

}  // namespace
}  // namespace brisvale::testing
