// The inventory over a registry model and a fake mount table: which media, mounts and
// cameras it lists, and the entry each gets.
#include "inventory/inventory.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "base/log.h"
#include "fake_os.h"
#include "media_records.h"
#include "platform/services.h"
#include "registry/registry_model.h"

namespace brisvale {
namespace {

using testing::Medium;

os::MountRecord Mount(std::string from, std::string on, uint32_t flags = 0) {
  return {flags, "ext4", std::move(on), std::move(from)};
}

struct InventoryTest : ::testing::Test {
  // A disk-image drive with one medium below it, as the loop driver publishes them.
  void AttachImage(const std::string& bsdName, const std::string& imagePath) {
    auto drive = registry.Publish(nullptr, "KxNimbrelHDDriveInKernel",
                                  {{"image-path", plist::Value(plist::Bytes(imagePath.begin(), imagePath.end()))}});
    registry.Publish(drive, "KxMedia", Medium(bsdName, false));
  }

  std::optional<MountEntry> Entry(const DeviceMap& map, std::string_view node) {
    const plist::Value* entry = map.find(node);
    return entry && entry->dictionary() ? std::optional(*entry->dictionary()) : std::nullopt;
  }

  registry::RegistryModel registry;
  testing::FakeOs os;
  ScopedServices services{Services{&registry, &os}};
  registry::ObjectRef usb = registry.Publish(nullptr, "KxUSBHostDevice", {{"removable", plist::Value::Bool(true)}});
  registry::ObjectRef internal = registry.Publish(nullptr, "KxAHCIDevice", {});
  log::CaptureSink capture;
};

// Listed by their own flag or an ancestor's; FAT, exFAT and NTFS as if mounted at their node.
TEST_F(InventoryTest, RemovableMediaListedByOwnFlagOrAncestor) {
  registry.Publish(usb, "KxMedia", Medium("sdb1", false));       // controller is removable
  registry.Publish(internal, "KxMedia", Medium("vda1", false));  // nothing removable above
  auto disk = registry.Publish(internal, "KxMedia", Medium("sdc", true, /*leaf=*/false, "GUID_partition_scheme"));
  registry.Publish(disk, "KxMedia", Medium("sdc1", true));
  registry.Publish(disk, "KxMedia", Medium("sdc2", true, true, "C12A7328-F81F-11D2-BA4B-00A0C93EC93B"));
  registry.Publish(disk, "KxMedia", Medium("sdc3", true, true, "Vantrel_partition_map"));
  plist::Dictionary noContent = Medium("sdd", true);
  noContent.erase("Content");
  registry.Publish(usb, "KxMedia", noContent);
  registry.Publish(usb, "KxMedia", Medium("sdf1", true));
  os.volumeHeaders["/dev/sdf1"] = testing::VolumeHeader("FAT");

  const std::optional<DeviceMap> media = CopyAttachedMediaEntries();
  ASSERT_TRUE(media);
  std::vector<std::string> nodes;
  for (const auto& [node, entry] : *media) nodes.push_back(node);
  EXPECT_THAT(nodes, ::testing::UnorderedElementsAre("/dev/sdb1", "/dev/sdc1", "/dev/sdf1"));
  EXPECT_EQ(Entry(*media, "/dev/sdb1"), (MountEntry{{"DeviceType", "MassStorage"},
                                                    {"DeviceNode", "/dev/sdb1"},
                                                    {"IsMounted", plist::Value::Bool(false)},
                                                    {"IsReadOnly", plist::Value::Bool(false)}}));
  EXPECT_EQ(*Entry(*media, "/dev/sdf1")->find("MountPath"), plist::Value("/dev/sdf1"));
  EXPECT_EQ(*Entry(*media, "/dev/sdf1")->find("FilesystemType"), plist::Value("exfat"));
  EXPECT_TRUE(capture.Contains(log::Level::Debug, "The attached media vda1 is not removable, ignoring."));
  EXPECT_TRUE(capture.Contains(log::Level::Debug, "The attached media sdc is not a leaf, ignoring."));
  EXPECT_TRUE(capture.Contains(log::Level::Debug, "Ignoring EFI partition."));
  EXPECT_TRUE(capture.Contains(log::Level::Debug, "Ignoring Vantrel_partition_map partition."));
  EXPECT_TRUE(capture.Contains(log::Level::Default, "The attached media object sdd does not have a 'Content' flag."));
}

// Only what is mounted below a mount root (a plain prefix) is mapped; disk images get the
// type their mount path gives and the signature their backing file's path holds.
TEST_F(InventoryTest, MountedFilesystemMapOfMountRootsAndDiskImages) {
  struct Case {
    const char* bsdName;
    const char* mountPath;
    const char* imagePath;
    std::optional<std::string> type;
    std::optional<plist::Bytes> signature;
    std::optional<std::string> line;
  };
  const Case cases[] = {
      {"loop1", "/Developer", "/private/var/run/AB12/CD34/i.dmg", "Developer", plist::Bytes{0xAB, 0x12, 0xCD, 0x34}, {}},
      {"loop2", "/Developer/Extra", "/a/0AB/C/i.dmg", "Personalized", plist::Bytes{0x0A, 0xBC}, {}},
      {"loop3", "/private/var/debug_mount", "/x/AB/CD/i.dmg", std::nullopt, plist::Bytes{0xAB, 0xCD}, {}},
      {"loop4", "/private/var/factory_mount", "/AB/i.dmg", "Factory", std::nullopt,
       "Failed to recover signature from /AB/i.dmg"},
      {"loop5", "/private/var/personalized_debug", "/x/A-/CD/i.dmg", "Personalized", std::nullopt,
       "Failed to convert signature from /x/A-/CD/i.dmg"},
  };
  for (const Case& c : cases) {
    AttachImage(c.bsdName, c.imagePath);
    os.mounts.push_back(Mount(std::string("/dev/") + c.bsdName, c.mountPath, os::kMountReadOnly));
  }
  os.mounts.insert(os.mounts.end(), {Mount("/dev/sdb1", "/private/var/mntx"), Mount("/dev/sdb2", "/private/var/mn"),
                                     Mount("/dev/sdb3", "/private/var/mnt/mount1", os::kMountReadOnly), Mount("proc", "/proc"),
                                     {os::kMountContentProtection, "hfs", "/private/var/debug_mount/x", "devfs"}});
  registry.Publish(usb, "KxMedia", Medium("sdb3", true));
  os.mounts.push_back(Mount("/dev/loop9", "/private/var/personalized_demo"));  // not in the registry
  auto driveWithoutPath = registry.Publish(nullptr, "KxNimbrelHDDriveInKernel", {});
  registry.Publish(driveWithoutPath, "KxMedia", Medium("loop8", false));
  os.mounts.push_back(Mount("/dev/loop8", "/private/var/personalized_automation"));

  const std::optional<DeviceMap> map = CopyMountedFilesystemMap();
  ASSERT_TRUE(map);
  for (const Case& c : cases) {
    SCOPED_TRACE(c.bsdName);
    const std::optional<MountEntry> entry = Entry(*map, std::string("/dev/") + c.bsdName);
    ASSERT_TRUE(entry);
    EXPECT_EQ(*entry->find("DeviceType"), plist::Value("DiskImage"));
    const plist::Value* type = entry->find("DiskImageType");
    EXPECT_EQ(type ? std::optional(*type->string()) : std::nullopt, c.type);
    const plist::Value* signature = entry->find("ImageSignature");
    EXPECT_EQ(signature ? std::optional(*signature->data()) : std::nullopt, c.signature);
    if (c.line) {
      EXPECT_TRUE(capture.Contains(log::Level::Default, *c.line));
    }
  }
  // A device the registry does not know stays mass storage.
  EXPECT_EQ(*Entry(*map, "/dev/loop9")->find("DeviceType"), plist::Value("MassStorage"));
  EXPECT_EQ(*Entry(*map, "/dev/sdb3"), (MountEntry{{"DeviceType", "MassStorage"},
                                                   {"DeviceNode", "/dev/sdb3"},
                                                   {"MountPath", "/private/var/mnt/mount1"},
                                                   {"FilesystemType", "ext4"},
                                                   {"IsMounted", plist::Value::Bool(true)},
                                                   {"IsReadOnly", plist::Value::Bool(true)}}));
  EXPECT_TRUE(map->find("/dev/sdb1"));  // "/private/var/mntx" starts like a root
  EXPECT_FALSE(map->find("/dev/sdb2") || map->find("proc"));
  EXPECT_EQ(*Entry(*map, "devfs")->find("SupportsContentProtection"), plist::Value::Bool(true));
  // Neither devfs nor a pseudo file system is looked for in the registry; a device is.
  EXPECT_THAT(capture.Texts(), ::testing::Contains(
      "Failed to retrieve the Kx service matching the device node for /dev/sdb2."));
  EXPECT_FALSE(capture.Contains(log::Level::Default,
                                "Failed to retrieve the Kx service matching the device node for devfs."));
  EXPECT_TRUE(capture.Contains(log::Level::Debug, "Skipping /private/var/mn, as we didn't mount it."));
  EXPECT_TRUE(capture.Contains(log::Level::Default,
                               "Failed to get backing image path for /private/var/personalized_automation"));
}

// (The lookups over this map are tested through the handlers that use them.)
TEST_F(InventoryTest, CombinedMapPrefersTheMount) {
  registry.Publish(usb, "KxMedia", Medium("sdb1", true));
  registry.Publish(usb, "KxMedia", Medium("sdb2", true));
  os.mounts = {Mount("/dev/sdb1", "/private/var/mnt/mount1")};
  registry.Publish(usb, "KxUSBHostInterface",
                   {{"bInterfaceClass", plist::Value::Int(6)}, {"bInterfaceSubClass", plist::Value::Int(1)},
                    {"bInterfaceProtocol", plist::Value::Int(1)}, {"locationID", plist::Value::Int(0x14200000)}});

  const std::optional<DeviceMap> devices = CopyAttachedDevices();
  ASSERT_TRUE(devices);
  EXPECT_EQ(devices->size(), 3u);  // one camera, sdb1 once (as its mount), sdb2
  EXPECT_EQ(*Entry(*devices, "/dev/sdb1")->find("MountPath"), plist::Value("/private/var/mnt/mount1"));
  EXPECT_EQ(Entry(*devices, "PTPNode"),
            (MountEntry{{"LocationID", plist::Value::Int(0x14200000)}, {"DeviceType", "PTPCamera"}}));
}

TEST(SignatureText, TwoDirectoriesAboveTheImage) {
  const std::pair<const char*, std::optional<std::string>> cases[] = {
      {"/private/var/run/AB12CD/34EF56/image.img", "AB12CD34EF56"},
      {"/a//b/c.dmg", "ab"},
      {"/a/c.dmg", std::nullopt},
  };
  for (const auto& [path, text] : cases) EXPECT_EQ(CopySignatureTextFromImagePath(path), text) << path;
}

}  // namespace
}  // namespace brisvale
