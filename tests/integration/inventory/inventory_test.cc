// "CopyDevices" against real loop-mounted images and simulated media in a sandbox root.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "loop_mount.h"
#include "plist_printers.h"
#include "sandbox_daemon.h"

namespace brisvale::testing {
namespace {

namespace fs = std::filesystem;

plist::Value Stick(const std::string& bsdName) {
  return DeviceObject("stick-" + bsdName, "KxUSBHostDevice", {{"removable", plist::Value::Bool(true)}},
                {DeviceObject("media", "KxMedia",
                        {{"BSD Name", plist::Value(bsdName)},
                         {"Content", "0x0C"},
                         {"Removable", plist::Value::Bool(false)},
                         {"Leaf", plist::Value::Bool(true)},
                         {"Writable", plist::Value::Bool(true)}})});
}

plist::Value Camera() {
  return DeviceObject("camera", "KxUSBHostDevice", {},
                {DeviceObject("ptp", "KxUSBHostInterface",
                        {{"bInterfaceClass", plist::Value::Int(6)},
                         {"bInterfaceSubClass", plist::Value::Int(1)},
                         {"bInterfaceProtocol", plist::Value::Int(1)},
                         {"locationID", plist::Value::Int(0x01100000)}})});
}

struct InventoryTest : ::testing::Test {
  void SetUp() override {
    BRISVALE_REQUIRE_ROOT();
    devicesFile = daemon.root() + "/devices.plist";
    WriteDevices({});
  }

  void WriteDevices(plist::Array objects) {
    std::ofstream(devicesFile) << plist::WriteXml(plist::Dictionary{{"Objects", plist::Value(std::move(objects))}});
  }

  // A simulated medium's node holds a FAT boot sector.
  void PlaceFatNode(const std::string& bsdName) {
    std::string sector = std::string("\xEB\x3C\x90MSDOS5.0", 11) + std::string(4096, '\0');
    std::ofstream node(daemon.Path("/dev/" + bsdName), std::ios::binary);
    node << sector;
    ASSERT_TRUE(node.good());
  }

  // The entries of a "CopyDevices" reply keyed by device node ("PTPNode" for a camera).
  std::map<std::string, plist::Dictionary> CopyDevices() {
    std::optional<plist::Value> reply;
    EXPECT_TRUE(daemon.SendRequest(plist::Dictionary{{"RequestType", "CopyDevices"}}, &reply).ok());
    std::map<std::string, plist::Dictionary> entries;
    if (!reply || !reply->get("EntryList") || !reply->get("EntryList")->array()) return entries;
    EXPECT_EQ(*reply->get("Status"), plist::Value("Success"));
    for (const plist::Value& entry : *reply->get("EntryList")->array()) {
      const std::string* node = entry.getString("DeviceNode");
      entries[node ? *node : "PTPNode"] = *entry.dictionary();
    }
    return entries;
  }

  std::unique_ptr<LoopMount> MountImage(const std::string& signatureDirs, const std::string& inside, bool readOnly) {
    const std::string imageDir = daemon.Path("/private/var/run/images/" + signatureDirs);
    fs::create_directories(imageDir);
    fs::create_directories(daemon.Path(inside));
    std::string error;
    const std::string image = imageDir + "/image.img";
    EXPECT_TRUE(MakeExt4Image(image, 2, "", &error)) << error;
    auto mount = LoopMount::Create(image, daemon.Path(inside), daemon.Path("/dev"), readOnly, &error);
    EXPECT_TRUE(mount) << error;
    return mount;
  }

  SandboxDaemon daemon;
  std::string devicesFile;
};

TEST_F(InventoryTest, LoopMountedImagesAreListedWithTypeAndSignature) {
  ASSERT_TRUE(daemon.Start({"--devices", "/devices.plist"}));
  auto developer = MountImage("AB12/CD34", "/Developer", true);
  auto debug = MountImage("0F/E", "/private/var/personalized_debug/x", true);
  auto media = MountImage("12/34", "/private/var/mnt/media1", false);
  ASSERT_TRUE(developer && debug && media);

  auto entries = CopyDevices();
  struct Expected {
    const LoopMount* mount;
    std::optional<std::string> type;
    bool readOnly;
    plist::Bytes signature;
  };
  const Expected expected[] = {
      {developer.get(), "Developer", true, {0xAB, 0x12, 0xCD, 0x34}},
      {debug.get(), "Personalized", true, {0x00, 0xFE}},  // odd length: a leading zero
      {media.get(), std::nullopt, false, {0x12, 0x34}},
  };
  for (const Expected& e : expected) {
    SCOPED_TRACE(e.mount->device());
    ASSERT_TRUE(entries.count(e.mount->device()));
    const plist::Dictionary& entry = entries[e.mount->device()];
    EXPECT_EQ(*entry.find("DeviceType"), plist::Value("DiskImage"));
    EXPECT_EQ(*entry.find("FilesystemType"), plist::Value("ext4"));
    EXPECT_EQ(*entry.find("IsReadOnly"), plist::Value::Bool(e.readOnly));
    EXPECT_EQ(*entry.find("ImageSignature"), plist::Value(e.signature));
    const plist::Value* type = entry.find("DiskImageType");
    EXPECT_EQ(type ? std::optional(*type->string()) : std::nullopt, e.type);
  }
}

TEST_F(InventoryTest, SimulatedMediaComeAndGoWithTheDevicesFile) {
  WriteDevices({Stick("sdx1"), Camera()});
  ASSERT_TRUE(daemon.Start({"--devices", "/devices.plist"}));
  PlaceFatNode("sdx1");  // the device root exists once the daemon has made it

  auto entries = CopyDevices();
  ASSERT_TRUE(entries.count("/dev/sdx1"));
  EXPECT_EQ(entries["/dev/sdx1"], (plist::Dictionary{{"DeviceType", "MassStorage"},
                                                      {"DeviceNode", "/dev/sdx1"},
                                                      {"MountPath", "/dev/sdx1"},
                                                      {"FilesystemType", "exfat"},
                                                      {"IsMounted", plist::Value::Bool(true)},
                                                      {"IsReadOnly", plist::Value::Bool(false)}}));
  EXPECT_EQ(entries["PTPNode"], (plist::Dictionary{{"LocationID", plist::Value::Int(0x01100000)},
                                                    {"DeviceType", "PTPCamera"}}));

  // A second stick without a recognised file system, and the camera pulled.
  WriteDevices({Stick("sdx1"), Stick("sdy1")});
  ASSERT_TRUE(daemon.PostHardwareEvent("com.vantrel.brisvale_mounter.attached").ok());
  ASSERT_TRUE(daemon.WaitForLogLine("debug: Kestrix Event: com.vantrel.brisvale_mounter.attached"));
  entries = CopyDevices();
  EXPECT_FALSE(entries.count("PTPNode"));
  ASSERT_TRUE(entries.count("/dev/sdy1"));
  EXPECT_EQ(*entries["/dev/sdy1"].find("IsMounted"), plist::Value::Bool(false));

  WriteDevices({});
  ASSERT_TRUE(daemon.PostHardwareEvent("com.vantrel.brisvale_mounter.detached").ok());
  ASSERT_TRUE(daemon.WaitForLogLine("debug: Kestrix Event: com.vantrel.brisvale_mounter.detached"));
  entries = CopyDevices();
  EXPECT_FALSE(entries.count("/dev/sdx1"));
  EXPECT_FALSE(entries.count("/dev/sdy1"));
}

}  // namespace
}  // namespace brisvale::testing
