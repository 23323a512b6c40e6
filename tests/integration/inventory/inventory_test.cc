// "CopyDevices" over real loop-mounted images in a sandbox root: the kernel's loop
// devices and mount table give each image its type, signature and read-only state.
// (Simulated media in the listing are the media events' integration test.)
#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <fstream>

#include "loop_mount.h"
#include "plist_printers.h"
#include "sandbox_daemon.h"

namespace brisvale::testing {
namespace {

namespace fs = std::filesystem;

TEST(InventoryTest, LoopMountedImagesAreListedWithTypeAndSignature) {
  BRISVALE_REQUIRE_ROOT();
  SandboxDaemon daemon;
  std::ofstream(daemon.Path("/devices.plist")) << plist::WriteXml(plist::Dictionary{{"Objects", plist::Array{}}});
  ASSERT_TRUE(daemon.Start({"--devices", "/devices.plist"}));
  struct Case {
    const char* signatureDirs;
    const char* mountPath;
    bool readOnly;
    std::optional<std::string> type;
    plist::Bytes signature;
    std::unique_ptr<LoopMount> mount = nullptr;
  } cases[] = {
      {"AB12/CD34", "/Developer", true, "Developer", {0xAB, 0x12, 0xCD, 0x34}},
      {"0F/E", "/private/var/personalized_debug/x", true, "Personalized", {0x00, 0xFE}},  // odd: a leading zero
      {"12/34", "/private/var/mnt/media1", false, std::nullopt, {0x12, 0x34}},
  };
  for (Case& c : cases) {
    const std::string image = daemon.Path(std::string("/private/var/run/images/") + c.signatureDirs + "/image.img");
    fs::create_directories(fs::path(image).parent_path());
    fs::create_directories(daemon.Path(c.mountPath));
    std::string error;
    ASSERT_TRUE(MakeExt4Image(image, 2, "", &error)) << error;
    c.mount = LoopMount::Create(image, daemon.Path(c.mountPath), daemon.Path("/dev"), c.readOnly, &error);
    ASSERT_TRUE(c.mount) << error;
  }

  std::optional<plist::Value> reply;
  ASSERT_TRUE(daemon.SendRequest(plist::Dictionary{{"RequestType", "CopyDevices"}}, &reply).ok());
  ASSERT_TRUE(reply && reply->get("EntryList") && reply->get("EntryList")->array());
  EXPECT_EQ(*reply->get("Status"), plist::Value("Success"));
  for (const Case& c : cases) {
    SCOPED_TRACE(c.mountPath);
    const plist::Array& entries = *reply->get("EntryList")->array();
    const auto entry = std::ranges::find_if(entries, [&](const plist::Value& e) {
      return e.getString("DeviceNode") && *e.getString("DeviceNode") == c.mount->device();
    });
    ASSERT_NE(entry, entries.end());
    EXPECT_EQ(*entry->get("DeviceType"), plist::Value("DiskImage"));
    EXPECT_EQ(*entry->get("FilesystemType"), plist::Value("ext4"));
    EXPECT_EQ(*entry->get("IsReadOnly"), plist::Value::Bool(c.readOnly));
    EXPECT_EQ(*entry->get("ImageSignature"), plist::Value(c.signature));
    const plist::Value* type = entry->get("DiskImageType");
    EXPECT_EQ(type ? std::optional(*type->string()) : std::nullopt, c.type);
  }
}

}  // namespace
}  // namespace brisvale::testing
