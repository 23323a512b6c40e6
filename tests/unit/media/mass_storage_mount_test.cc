// Check, repair and mount of removable media over a fake operating system whose tools
// answer from the test, plus the real spawn-and-wait against /bin/sh.
#include "media/mass_storage_mount.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdlib>
#include <set>

#include "base/log.h"
#include "fake_os.h"
#include "media/fs_check.h"
#include "plist_printers.h"
#include "platform/services.h"
#include "platform/system_notify.h"
#include "registry/registry_model.h"

namespace brisvale {
namespace {

using ::testing::ElementsAre;
using Argv = std::vector<std::string>;

constexpr int kSpawnMissing = -1000;  // a tool answer meaning "the program is not there"

// Paths, spawned tools and mounts: mount_hfs mounts at the canonical /private/var path.
struct ToolOs : testing::FakeOs {
  std::set<std::string> existing{"/var/mnt"};
  std::vector<Argv> spawned;
  std::map<std::string, int> answers;  // "fsck_hfs -q" -> exit status, or kSpawnMissing
  int lastAnswer = 0;

  int StatPath(const char* path, os::FileStatus&) override { return existing.count(path) ? 0 : -ENOENT; }
  int MakeDirectory(const char* path, uint32_t) override {
    return existing.insert(path).second ? 0 : -EEXIST;
  }
  int ChangeMode(const char*, uint32_t) override { return 0; }
  int RealPath(const char* path, std::string& resolved) override {
    resolved = std::string(path).starts_with("/var/") ? "/private" + std::string(path) : path;
    return 0;
  }
  int SpawnProgram(const Argv& argv) override {
    spawned.push_back(argv);
    const std::string tool = argv[0].substr(argv[0].rfind('/') + 1) + " " + argv[1];
    lastAnswer = answers.count(tool) ? answers[tool] : 0;
    if (lastAnswer == kSpawnMissing) return -ENOENT;
    if (tool == "mount_hfs -o" && lastAnswer == 0) {
      mounts.push_back({argv[2] == "rdonly" ? os::kMountReadOnly : 0, "hfs", "/private" + argv[4], argv[3]});
    }
    return 4242;
  }
  int WaitForChild(int, int& waitStatus) override {
    waitStatus = lastAnswer << 8;
    return 0;
  }
};

struct CountingNotify : notify::SystemNotify {
  std::vector<std::string> posted;
  void Post(const notify::Notification& n) override { posted.push_back(n.name); }
};

std::vector<uint8_t> Header(std::string_view kind) {
  std::vector<uint8_t> header(1028, 0);
  if (kind == "HFS+" || kind == "HFSX") {
    header[1024] = 'H', header[1025] = kind == "HFS+" ? '+' : 'X', header[1027] = kind == "HFS+" ? 4 : 5;
  } else {
    const std::string oem = kind == "NTFS" ? "NTFS    " : kind == "EXFAT" ? "EXFAT   " : "MSDOS5.0";
    header[0] = 0xEB, header[2] = 0x90;
    std::copy(oem.begin(), oem.end(), header.begin() + 3);
  }
  return header;
}

class MassStorageTest : public ::testing::Test {
 protected:
  MassStorageTest() : services_(Services{&registry, &os, nullptr, &notify}) {
    auto usb = registry.Publish(nullptr, "KxUSBHostDevice", {{"removable", plist::Value::Bool(true)}});
    registry.Publish(usb, "KxMedia", {{"BSD Name", plist::Value("sdb1")}, {"Leaf", plist::Value::Bool(true)},
                                      {"Removable", plist::Value::Bool(true)}, {"Content", plist::Value("")}});
  }
  registry::RegistryModel registry;
  ToolOs os;
  CountingNotify notify;
  log::CaptureSink capture;

 private:
  ScopedServices services_;
};

TEST_F(MassStorageTest, OutcomeFlagsAndMountPointByVolumeToolsAndPresentPaths) {
  const std::set<std::string> four{"/var/mnt/mount1", "/var/mnt/mount2", "/var/mnt/mount3", "/var/mnt/mount4"};
  struct Case {
    std::string volume;
    std::map<std::string, int> answers;
    std::set<std::string> present;
    std::optional<std::string> result;
    bool verificationFailed, mountFailed;
    std::string line;
  };
  const Case cases[] = {
      {"HFS+", {}, {}, "/private/var/mnt/mount1", false, false, "Successfully mounted /var/mnt/mount1."},
      {"HFSX", {{"fsck_hfs -q", 3}}, {"/var/mnt/mount1"}, "/private/var/mnt/mount2", false, false,
       "The filesystem at /dev/sdb1 appears to be dirty."},
      {"HFS+", {}, {"/var/mnt/mount2"}, "/private/var/mnt/mount1", false, false, "Posting notification: com.vantrel.brisvale_mounted"},
      {"HFS+", {}, four, std::nullopt, false, true, "Failed to determine mount path."},
      {"HFS+", {{"fsck_hfs -fy", 8}}, {}, std::nullopt, true, false, "Repairing the HFS+ filesystem at /dev/sdb1."},
      {"HFS+", {{"fsck_hfs -fy", kSpawnMissing}}, {}, std::nullopt, true, false, "Failed to spawn /sbin/fsck_hfs : 2"},
      {"HFS+", {{"mount_hfs -o", 1}}, {}, std::nullopt, false, true, "Failed to mount /dev/sdb1 on /var/mnt/mount1."},
      {"NTFS", {}, {}, std::nullopt, false, true, "Unknown or unsupported filesystem at /dev/sdb1: [MSDOS_NTFS]."},
      {"none", {}, {}, std::nullopt, false, true, "Unknown or unsupported filesystem at /dev/sdb1: [Unknown]."},
      {"FAT", {}, {}, "/dev/sdb1", false, false, "MSDOS FAT filesystem at /dev/sdb1. Skipping mount."},
      {"EXFAT", {}, {}, "/dev/sdb1", false, false, "MSDOS EXFAT filesystem at /dev/sdb1. Skipping mount."},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.line);
    os.existing = c.present, os.existing.insert("/var/mnt"), os.mounts.clear(), os.answers = c.answers;
    notify.posted.clear(), capture.Clear(), os.volumeHeaders.clear(), os.spawned.clear();
    if (c.volume != "none") os.volumeHeaders["/dev/sdb1"] = Header(c.volume);
    bool verificationFailed = false, mountFailed = false;
    EXPECT_EQ(MountMassStorageDevice("/dev/sdb1", false, verificationFailed, mountFailed), c.result);
    EXPECT_EQ(verificationFailed, c.verificationFailed);
    EXPECT_EQ(mountFailed, c.mountFailed);
    EXPECT_THAT(capture.Texts(), ::testing::Contains(c.line));
    EXPECT_EQ(notify.posted, c.result ? std::vector<std::string>{"com.vantrel.brisvale_mounted"} : std::vector<std::string>{});
    // FAT and exFAT never reach a tool; a mount point is made only after a passed repair.
    EXPECT_EQ(os.spawned.empty(), !c.volume.starts_with("HFS"));
    EXPECT_EQ(os.existing.size() - c.present.size() - 1, c.volume.starts_with("HFS") && !c.verificationFailed && c.present != four);
  }
}

TEST_F(MassStorageTest, RequestValidatesNodeAndReadsReadOnlyAsBooleanOnly) {
  struct Case { plist::Dictionary request; std::string optionOrLine; };
  const Case cases[] = {
      {{}, "Invalid value for DeviceNode: (null)"},
      {{{"DeviceNode", plist::Value::Int(3)}}, "Invalid value for DeviceNode: 3"},
      {{{"DeviceNode", plist::Value("/dev/sdz9")}}, "There is no matching mass storage entry for /dev/sdz9."},
      {{{"DeviceNode", plist::Value("/dev/sdb1")}, {"MountReadOnly", plist::Value::Bool(true)}}, "rdonly"},
      {{{"DeviceNode", plist::Value("/dev/sdb1")}, {"MountReadOnly", plist::Value("true")}}, "noowners"},
      {{{"DeviceNode", plist::Value("/dev/sdb1")}, {"MountReadOnly", plist::Value::Int(1)}}, "noowners"},
  };
  os.volumeHeaders["/dev/sdb1"] = Header("HFS+");
  for (const Case& c : cases) {
    os.existing = {"/var/mnt"}, os.mounts.clear(), os.spawned.clear(), capture.Clear();
    plist::Dictionary reply{{"Status", plist::Value("Failure")}};
    HandleMassStorageMount(plist::Value(c.request), reply);
    const bool mounted = c.optionOrLine == "rdonly" || c.optionOrLine == "noowners";
    EXPECT_EQ(*reply.find("Status"), plist::Value(mounted ? "Success" : "Failure"))
        << c.optionOrLine;
    if (!mounted) {
      EXPECT_TRUE(capture.Contains(log::Level::Default, c.optionOrLine)) << c.optionOrLine;
      continue;
    }
    EXPECT_EQ(*reply.find("MountPath"), plist::Value("/private/var/mnt/mount1"));
    EXPECT_EQ(os.spawned.back(), (Argv{"/sbin/mount_hfs", "-o", c.optionOrLine, "/dev/sdb1", "/var/mnt/mount1"}));
  }
  // Asked again while mounted: refused before any tool runs.
  os.spawned.clear();
  plist::Dictionary reply;
  HandleMassStorageMount(plist::Value(plist::Dictionary{{"DeviceNode", plist::Value("/dev/sdb1")}}), reply);
  EXPECT_TRUE(capture.Contains(log::Level::Default, "/dev/sdb1 is already mounted."));
  EXPECT_TRUE(os.spawned.empty());
  EXPECT_EQ(reply.find("MountPath"), nullptr);
}

// The real spawn and wait: exit statuses pass through, a signal and a missing tool are -1.
TEST(RunToolAndWaitTest, RealToolStatuses) {
  ScopedServices services(Services{nullptr, &os::SystemOs()});
  log::CaptureSink capture;
  EXPECT_EQ(RunToolAndWait({"/bin/sh", "-c", "exit 0"}), 0);
  EXPECT_EQ(RunToolAndWait({"/bin/sh", "-c", "exit 8"}), 8);
  EXPECT_EQ(RunToolAndWait({"/bin/sh", "-c", "kill -KILL $$"}), -1);
  setenv("BRISVALE_PROBE", "inherited", 1);
  EXPECT_EQ(RunToolAndWait({"/bin/sh", "-c", "test -z \"$BRISVALE_PROBE$HOME\""}), 0);  // no environment
  EXPECT_EQ(RunToolAndWait({"/nonexistent/fsck_hfs", "-q", "/dev/x"}), -1);
  EXPECT_THAT(capture.Texts(), ElementsAre("Failed to spawn /nonexistent/fsck_hfs : 2"));
}

}  // namespace
}  // namespace brisvale
