// The start-up clean-up, "CopyDevices", "Sync" and "Unmount" against real loop-mounted
// images, in one run of the daemon in a sandbox root: the kernel's loop devices and mount
// table are what the daemon lists and takes away. (Unknown paths, simulated media, and
// links, flags, special files and mounts inside stale trees, are the unit tests'.)
#include <fcntl.h>
#include <sys/mount.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <fstream>

#include "base/unique_fd.h"
#include "loop_mount.h"
#include "platform/linux/notify_center.h"
#include "plist_printers.h"
#include "sandbox_daemon.h"

namespace brisvale::testing {
namespace {

namespace fs = std::filesystem;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

const plist::Value kFailure = plist::Dictionary{{"Status", "Failure"}};
const plist::Value kSuccess = plist::Dictionary{{"Status", "Success"}};

TEST(UnmountTest, StartupCleanupListingSyncAndUnmountThatEjectsOnlyTheDeviceHoldingAMount) {
  BRISVALE_REQUIRE_ROOT();
  SandboxDaemon daemon;
  std::string error;
  int images = 0;
  // Each image two directories below where its signature is read from: AB10, AB11, ...
  const auto mountImage = [&](const std::string& inside) {
    fs::create_directories(daemon.Path(inside));
    const std::string dir = daemon.Path("/private/var/run/images/AB/" + std::to_string(10 + images++));
    fs::create_directories(dir);
    const std::string image = dir + "/image.img";
    EXPECT_TRUE(MakeExt4Image(image, 2, "", &error)) << error;
    auto mount = LoopMount::Create(image, daemon.Path(inside), daemon.Path("/dev"), false, &error);
    EXPECT_TRUE(mount) << error;
    return mount;
  };

  // Stale trees in each mount root go at start; a live mount and everything outside stay.
  for (const char* root : {"/private/var/mnt", "/private/var/factory_mount", "/private/var/personalized_factory"}) {
    fs::create_directories(daemon.Path(root) + "/stale/a");
    std::ofstream(daemon.Path(root) + "/stale/a/file") << "x";
  }
  std::ofstream(daemon.Path("/precious")) << "outside every root";
  fs::create_directories(daemon.Path("/dev"));
  auto live = mountImage("/private/var/mnt/live");
  ASSERT_TRUE(live);
  std::ofstream(daemon.Path("/private/var/mnt/live/data")) << "live";
  ASSERT_TRUE(daemon.Start());
  for (const char* root : {"/private/var/mnt", "/private/var/factory_mount", "/private/var/personalized_factory"}) {
    EXPECT_FALSE(fs::exists(daemon.Path(root) + "/stale")) << root;
  }
  EXPECT_TRUE(fs::exists(daemon.Path("/private/var/mnt/live/data")));
  EXPECT_TRUE(fs::exists(daemon.Path("/precious")));
  EXPECT_TRUE(daemon.LogContains("debug: Skipping destruction of mounted filesystem /private/var/mnt/live."));

  const auto subscriber = notify::Subscriber::Create(daemon.Path("/private/var/run/vexa/notify"), &error);
  ASSERT_TRUE(subscriber) << error;
  const auto received = [&] {  // the names of the notifications that arrived within a short while
    std::vector<std::string> names;
    while (auto notification = subscriber->Receive(std::chrono::milliseconds(300))) {
      names.push_back(notification->name);
    }
    return names;
  };
  const auto request = [&](const char* type, const std::string& mountPath) {
    std::optional<plist::Value> reply;
    EXPECT_TRUE(daemon.SendRequest(plist::Dictionary{{"RequestType", type}, {"MountPath", plist::Value(mountPath)}},
                                   &reply).ok());
    return reply.value_or(plist::Value());
  };

  // Listed with the type its mount path gives and the signature its backing file's path
  // holds; the Developer directory stays after its unmount, other mount points go.
  auto developer = mountImage("/Developer");
  auto media = mountImage("/private/var/mnt/media1");
  ASSERT_TRUE(developer && media);
  std::optional<plist::Value> devices;
  ASSERT_TRUE(daemon.SendRequest(plist::Dictionary{{"RequestType", "CopyDevices"}}, &devices).ok());
  const plist::Value* entries = devices ? devices->get("EntryList") : nullptr;
  ASSERT_TRUE(entries && entries->array());
  const plist::Dictionary listed{{"DeviceType", plist::Value("DiskImage")},
                                 {"DeviceNode", plist::Value(developer->device())},
                                 {"MountPath", plist::Value("/Developer")},
                                 {"FilesystemType", plist::Value("ext4")},
                                 {"IsMounted", plist::Value::Bool(true)},
                                 {"DiskImageType", plist::Value("Developer")},
                                 {"IsReadOnly", plist::Value::Bool(false)},
                                 {"ImageSignature", plist::Value(plist::Bytes{0xAB, 0x11})}};
  EXPECT_EQ(std::ranges::count(*entries->array(), plist::Value(listed)), 1);
  std::ofstream(daemon.Path("/private/var/mnt/media1/data")) << "to be flushed";
  EXPECT_EQ(request("Sync", "/private/var/mnt/media1"), kSuccess);
  EXPECT_EQ(request("Unmount", "/Developer"), kSuccess);
  EXPECT_TRUE(fs::is_directory(daemon.Path("/Developer")));
  EXPECT_THAT(MountPointsBelow(daemon.Path("/Developer")), IsEmpty());
  EXPECT_EQ(request("Unmount", "/private/var/mnt/media1"), kSuccess);
  EXPECT_FALSE(fs::exists(daemon.Path("/private/var/mnt/media1")));
  EXPECT_THAT(received(), ElementsAre("com.vantrel.brisvale_unmounted", "com.vantrel.brisvale_unmounted"));

  // A busy volume still goes; a file under the mount keeps the directory, and the request fails.
  fs::create_directories(daemon.Path("/private/var/mnt/media2"));
  std::ofstream(daemon.Path("/private/var/mnt/media2/hidden")) << "under the mount";
  auto busy = mountImage("/private/var/mnt/media2");
  ASSERT_TRUE(busy);
  const UniqueFd held(::open(daemon.Path("/private/var/mnt/media2/lost+found").c_str(), O_RDONLY | O_DIRECTORY));
  ASSERT_TRUE(held);
  EXPECT_EQ(request("Unmount", "/private/var/mnt/media2"), kFailure);
  EXPECT_THAT(MountPointsBelow(daemon.Path("/private/var/mnt/media2")), IsEmpty());
  EXPECT_TRUE(fs::exists(daemon.Path("/private/var/mnt/media2/hidden")));
  EXPECT_TRUE(daemon.LogContains("default: Failed to remove /private/var/mnt/media2: Directory not empty"));
  EXPECT_THAT(received(), IsEmpty());

  // A memory file system mounted with a loop device's name as its source: the device
  // holds nothing of it and stays attached; the unmount itself still succeeds.
  auto holder = mountImage("/private/var/mnt/held");
  ASSERT_TRUE(holder);
  fs::create_directories(daemon.Path("/private/var/mnt/media3"));
  ASSERT_EQ(::mount(holder->device().c_str(), daemon.Path("/private/var/mnt/media3").c_str(), "tmpfs", 0, nullptr), 0);
  EXPECT_EQ(request("Unmount", "/private/var/mnt/media3"), kSuccess);
  EXPECT_TRUE(daemon.LogContains("default: Failed to eject " + holder->device() + " : 19"));
  EXPECT_THAT(received(), ElementsAre("com.vantrel.brisvale_unmounted"));
  EXPECT_TRUE(fs::exists("/sys/block/" + holder->device().substr(5) + "/loop/backing_file")) << "detached";
  EXPECT_FALSE(MountPointsBelow(daemon.Path("/private/var/mnt/held")).empty());
}

}  // namespace
}  // namespace brisvale::testing
