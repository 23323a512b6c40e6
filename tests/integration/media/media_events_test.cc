// Hardware events against the real daemon in a sandbox root: simulated sticks plugged
// and pulled by editing the devices file, checked and mounted by the tool doubles, and
// simulated cameras announced.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <sstream>
#include <thread>

#include "media_doubles.h"
#include "plist_printers.h"
#include "sandbox_daemon.h"

namespace brisvale::testing {
namespace {

using namespace std::chrono_literals;

plist::Value Medium(const std::string& bsdName, bool removable, bool leaf, const std::string& content) {
  return DeviceObject(bsdName, "KxMedia",
                {{"BSD Name", plist::Value(bsdName)}, {"Content", plist::Value(content)},
                 {"Removable", plist::Value::Bool(removable)}, {"Leaf", plist::Value::Bool(leaf)},
                 {"Writable", plist::Value::Bool(true)}});
}

// A USB device holding one medium that is a whole volume.
plist::Value Stick(const std::string& bsdName) {
  return DeviceObject("usb-" + bsdName, "KxUSBHostDevice", {{"removable", plist::Value::Bool(true)}},
                {Medium(bsdName, true, true, "")});
}

// A USB disk with a GUID partition table: the whole disk, its EFI partition and one data
// partition, which calls itself not removable like partitions do.
plist::Value PartitionedStick(const std::string& disk) {
  plist::Value wholeDisk = Medium(disk, true, false, "GUID_partition_scheme");
  plist::Dictionary withChildren = *wholeDisk.dictionary();
  withChildren.set("Children", plist::Array{Medium(disk + "1", false, true, "C12A7328-F81F-11D2-BA4B-00A0C93EC93B"),
                                            Medium(disk + "2", false, true, "48465300-0000-11AA-AA11-00306543ECAC")});
  return DeviceObject("usb-" + disk, "KxUSBHostDevice", {{"removable", plist::Value::Bool(true)}},
                {plist::Value(std::move(withChildren))});
}

plist::Value Camera(const std::string& name, int64_t location) {
  return DeviceObject(name, "KxUSBHostDevice", {{"removable", plist::Value::Bool(true)}},
                {DeviceObject("ptp", "KxUSBHostInterface",
                        {{"bInterfaceClass", plist::Value::Int(6)}, {"bInterfaceSubClass", plist::Value::Int(1)},
                         {"bInterfaceProtocol", plist::Value::Int(1)}, {"locationID", plist::Value::Int(location)}})});
}

void WriteDevices(const SandboxDaemon& daemon, plist::Array objects) {
  std::ofstream(daemon.Path("/devices.plist"))
      << plist::WriteXml(plist::Dictionary{{"Objects", plist::Value(std::move(objects))}});
}

bool IsMountPoint(const std::string& path) {
  std::ifstream table("/proc/self/mounts");
  std::string from, on, rest;
  while (table >> from >> on && std::getline(table, rest)) {
    if (on == path) return true;
  }
  return false;
}

std::optional<plist::Dictionary> ListedDevice(SandboxDaemon& daemon, const std::string& node) {
  std::optional<plist::Value> reply;
  if (!daemon.SendRequest(plist::Dictionary{{"RequestType", "CopyDevices"}}, &reply).ok() || !reply) return {};
  const plist::Value* list = reply->get("EntryList");
  for (const plist::Value& entry : list && list->array() ? *list->array() : plist::Array{}) {
    const std::string* entryNode = entry.getString("DeviceNode");
    if (node == "PTPNode" ? entry.getString("DeviceType") && *entry.getString("DeviceType") == "PTPCamera"
                          : entryNode && *entryNode == node) {
      return *entry.dictionary();
    }
  }
  return {};
}

size_t CountLines(const SandboxDaemon& daemon, const std::string& line) {
  const auto lines = daemon.LogLines();
  return static_cast<size_t>(std::count(lines.begin(), lines.end(), line));
}

struct MediaEventsTest : ::testing::Test {
  void SetUp() override {
    BRISVALE_REQUIRE_ROOT();
    ASSERT_TRUE(InstallToolDoubles(daemon));
    WriteDevices(daemon, {});
    ASSERT_TRUE(daemon.Start({"--devices", "/devices.plist"}));
  }
  SandboxDaemon daemon;
};

TEST_F(MediaEventsTest, SticksAndCamerasArePluggedAnnouncedListedAndSticksTakenAwayWhenPulled) {
  ASSERT_TRUE(PlaceVolume(daemon, "sdb2", "hfs+", "dirty"));
  ASSERT_TRUE(PlaceVolume(daemon, "sdc1", "hfsx"));
  ASSERT_TRUE(PlaceVolume(daemon, "sdd1", "fat"));
  WriteDevices(daemon, {PartitionedStick("sdb"), Stick("sdc1"), Stick("sdd1"), Camera("camera-a", 0x14100000),
                        Camera("camera-b", 0x14200000)});
  ASSERT_TRUE(daemon.PostHardwareEvent("com.vantrel.mobile.ptp_camera").ok());
  ASSERT_TRUE(daemon.PostHardwareEvent("com.vantrel.brisvale_mounter.attached").ok());
  ASSERT_TRUE(daemon.WaitForLogLine("default: Successfully mounted /var/mnt/mount2."));

  EXPECT_TRUE(daemon.LogContains("debug: The attached media sdb is not a leaf, ignoring."));
  EXPECT_TRUE(daemon.LogContains("debug: Ignoring EFI partition."));
  EXPECT_TRUE(daemon.LogContains("debug: Successfully repaired /dev/sdb2."));
  EXPECT_EQ(CountLines(daemon, "default: Posting notification: com.vantrel.brisvale_mounted"), 3u)
      << "two mounts and the FAT stick's record";
  EXPECT_TRUE(IsMountPoint(daemon.Path("/private/var/mnt/mount1")));
  EXPECT_TRUE(IsMountPoint(daemon.Path("/private/var/mnt/mount2")));
  const auto listed = ListedDevice(daemon, "/dev/sdc1");
  ASSERT_TRUE(listed);
  EXPECT_EQ(*listed->find("MountPath"), plist::Value("/private/var/mnt/mount2"));
  EXPECT_TRUE(ListedDevice(daemon, "/dev/sdd1")) << "a FAT stick is listed though not mounted";
  // Each camera is announced; the list holds the last one found.
  EXPECT_EQ(CountLines(daemon, "default: Posting notification: com.vantrel.mobile.camera_attached"), 2u);
  const auto camera = ListedDevice(daemon, "PTPNode");
  ASSERT_TRUE(camera);
  EXPECT_EQ(*camera->find("LocationID"), plist::Value::Int(0x14200000));

  // A second event finds them mounted and runs no tool.
  ASSERT_TRUE(daemon.PostHardwareEvent("com.vantrel.brisvale_mounter.attached").ok());
  ASSERT_TRUE(daemon.WaitForLogLine("default: /dev/sdc1 is already mounted."));
  EXPECT_EQ(CountLines(daemon, "default: Successfully mounted /var/mnt/mount1."), 1u);

  // Pulled without an eject: only that stick's mount and mount point go.
  WriteDevices(daemon, {Stick("sdc1"), Stick("sdd1")});
  ASSERT_TRUE(daemon.PostHardwareEvent("com.vantrel.brisvale_mounter.detached").ok());
  ASSERT_TRUE(daemon.WaitForLogLine("default: Posting notification: com.vantrel.brisvale_unmounted"));
  EXPECT_FALSE(IsMountPoint(daemon.Path("/private/var/mnt/mount1")));
  EXPECT_FALSE(std::filesystem::exists(daemon.Path("/private/var/mnt/mount1")));
  EXPECT_TRUE(IsMountPoint(daemon.Path("/private/var/mnt/mount2")));
  EXPECT_FALSE(ListedDevice(daemon, "/dev/sdb2"));
}

// Waits up to two seconds for `text` in the file at `path`.
bool WaitForText(const std::string& path, const std::string& text) {
  for (int i = 0; i < 40; ++i) {
    std::ifstream in(path);
    std::stringstream content;
    content << in.rdbuf();
    if (content.str().find(text) != std::string::npos) return true;
    std::this_thread::sleep_for(50ms);
  }
  return false;
}

TEST_F(MediaEventsTest, UnusableSticksRaiseTheirAlertsThroughTheAgent) {
  // One alert shows at a time, and this agent answers each at once.
  const std::string agentOutput = daemon.Path("/agent.out");
  const pid_t agent = fork();
  ASSERT_GE(agent, 0);
  if (agent == 0) {
    if (!freopen(agentOutput.c_str(), "w", stdout)) _exit(127);
    execl(BRISVALE_CTL_PATH, BRISVALE_CTL_PATH, "--root", daemon.root().c_str(), "--json",
          "--auto-dismiss", "0", "alert-agent", nullptr);
    _exit(127);
  }
  EXPECT_TRUE(WaitForText(agentOutput, "listening"));
  ASSERT_TRUE(PlaceVolume(daemon, "sde1", "ntfs"));
  ASSERT_TRUE(PlaceVolume(daemon, "sdf1", "hfs+", "broken"));
  WriteDevices(daemon, {Stick("sde1")});
  ASSERT_TRUE(daemon.PostHardwareEvent("com.vantrel.brisvale_mounter.attached").ok());
  EXPECT_TRUE(daemon.WaitForLogLine("default: Failed to mount /dev/sde1."));
  EXPECT_TRUE(WaitForText(agentOutput, "Cannot Use Storage Device"));
  EXPECT_TRUE(WaitForText(agentOutput, "\"answered\""));

  WriteDevices(daemon, {Stick("sdf1")});
  ASSERT_TRUE(daemon.PostHardwareEvent("com.vantrel.brisvale_mounter.attached").ok());
  EXPECT_TRUE(daemon.WaitForLogLine("default: Failed to mount /dev/sdf1: verification failed"));
  EXPECT_TRUE(WaitForText(agentOutput, "Storage Device Needs Repair"));
  kill(agent, SIGTERM);
  waitpid(agent, nullptr, 0);
}

}  // namespace
}  // namespace brisvale::testing
