// "CopyDevices" over a real loop-mounted image in a sandbox root: the kernel's loop
// device and mount table give the image its type, signature and read-only state.
// (Simulated media in the listing are the media events' integration test.)
#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>

#include "loop_mount.h"
#include "plist_printers.h"
#include "sandbox_daemon.h"

namespace brisvale::testing {
namespace {

TEST(InventoryTest, LoopMountedImageIsListedWithTypeAndSignature) {
  BRISVALE_REQUIRE_ROOT();
  SandboxDaemon daemon;
  ASSERT_TRUE(daemon.Start());
  const std::string image = daemon.Path("/private/var/run/images/AB12/CD34/image.img");
  std::filesystem::create_directories(daemon.Path("/private/var/run/images/AB12/CD34"));
  std::filesystem::create_directories(daemon.Path("/Developer"));
  std::string error;
  ASSERT_TRUE(MakeExt4Image(image, 2, "", &error)) << error;
  const auto mount = LoopMount::Create(image, daemon.Path("/Developer"), daemon.Path("/dev"), true, &error);
  ASSERT_TRUE(mount) << error;

  std::optional<plist::Value> reply;
  ASSERT_TRUE(daemon.SendRequest(plist::Dictionary{{"RequestType", "CopyDevices"}}, &reply).ok());
  const plist::Value* entries = reply ? reply->get("EntryList") : nullptr;
  ASSERT_TRUE(entries && entries->array());
  const plist::Dictionary expected{{"DeviceType", plist::Value("DiskImage")},
                                   {"DeviceNode", plist::Value(mount->device())},
                                   {"MountPath", plist::Value("/Developer")},
                                   {"FilesystemType", plist::Value("ext4")},
                                   {"IsMounted", plist::Value::Bool(true)},
                                   {"DiskImageType", plist::Value("Developer")},
                                   {"IsReadOnly", plist::Value::Bool(true)},
                                   {"ImageSignature", plist::Value(plist::Bytes{0xAB, 0x12, 0xCD, 0x34})}};
  EXPECT_EQ(std::count(entries->array()->begin(), entries->array()->end(), plist::Value(expected)), 1);
}

}  // namespace
}  // namespace brisvale::testing
