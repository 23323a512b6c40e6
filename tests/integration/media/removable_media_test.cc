// Removable media against the real daemon in a sandbox root: simulated sticks mounted by
// request, and plugged and pulled by editing the devices file, checked and mounted by
// the tool doubles; failures shown, answered and cancelled through the console alert
// agent; simulated cameras announced.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <thread>

#include "base/unique_fd.h"
#include "media_doubles.h"
#include "platform/linux/notify_center.h"
#include "plist_printers.h"
#include "sandbox_daemon.h"

namespace brisvale::testing {
namespace {

using namespace std::chrono_literals;
using ::testing::StartsWith;

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
  plist::Dictionary wholeDisk = *Medium(disk, true, false, "GUID_partition_scheme").dictionary();
  wholeDisk.set("Children", plist::Array{Medium(disk + "1", false, true, "C12A7328-F81F-11D2-BA4B-00A0C93EC93B"),
                                         Medium(disk + "2", false, true, "48465300-0000-11AA-AA11-00306543ECAC")});
  return DeviceObject("usb-" + disk, "KxUSBHostDevice", {{"removable", plist::Value::Bool(true)}},
                      {plist::Value(std::move(wholeDisk))});
}

// A USB device with one still-image interface (protocol 1) or another one.
plist::Value Camera(const std::string& name, std::optional<int64_t> location, int64_t protocol = 1) {
  plist::Dictionary interface{{"bInterfaceClass", plist::Value::Int(6)}, {"bInterfaceSubClass", plist::Value::Int(1)},
                              {"bInterfaceProtocol", plist::Value::Int(protocol)}};
  if (location) interface.set("locationID", plist::Value::Int(*location));
  return DeviceObject(name, "KxUSBHostDevice", {{"removable", plist::Value::Bool(true)}},
                      {DeviceObject("ptp", "KxUSBHostInterface", std::move(interface))});
}

// The type and options of what is mounted at `path` (as seen from outside), or "".
std::string MountOptions(const std::string& path) {
  std::ifstream table("/proc/self/mounts");
  std::string from, on, type, options, rest, found;
  while (table >> from >> on >> type >> options && std::getline(table, rest)) {
    if (on == path) found = from + " " + type + " " + options;
  }
  return found;
}

// The "CopyDevices" entry of `node`, or of the camera for "PTPNode".
std::optional<plist::Dictionary> ListedDevice(SandboxDaemon& daemon, const std::string& node) {
  std::optional<plist::Value> reply;
  if (!daemon.SendRequest(plist::Dictionary{{"RequestType", "CopyDevices"}}, &reply).ok() || !reply) return {};
  const plist::Value* list = reply->get("EntryList");
  for (const plist::Value& entry : list && list->array() ? *list->array() : plist::Array{}) {
    const std::string* key = entry.getString(node == "PTPNode" ? "DeviceType" : "DeviceNode");
    if (key && *key == (node == "PTPNode" ? "PTPCamera" : node)) return *entry.dictionary();
  }
  return {};
}

// Waits up to two seconds for `text` in the file at `path`.
bool WaitForText(const std::string& path, const std::string& text) {
  for (int i = 0; i < 40; ++i, std::this_thread::sleep_for(50ms)) {
    std::ifstream in(path);
    if (std::string{std::istreambuf_iterator<char>(in), {}}.find(text) != std::string::npos) return true;
  }
  return false;
}

struct MediaTest : ::testing::Test {
  void SetUp() override {
    BRISVALE_REQUIRE_ROOT();
    ASSERT_TRUE(InstallToolDoubles(daemon));
  }
  // Starts the daemon over the simulated `volumes` ({bsdName, kind, marker}) and `devices`.
  void Start(const std::vector<std::array<std::string, 3>>& volumes, plist::Array devices) {
    for (const auto& [bsdName, kind, marker] : volumes) ASSERT_TRUE(PlaceVolume(daemon, bsdName, kind, marker));
    WriteDevices(std::move(devices));
    ASSERT_TRUE(daemon.Start({"--devices", "/devices.plist"}));
  }
  void WriteDevices(plist::Array objects) {
    std::ofstream(daemon.Path("/devices.plist"))
        << plist::WriteXml(plist::Dictionary{{"Objects", plist::Value(std::move(objects))}});
  }
  SandboxDaemon daemon;
};

TEST_F(MediaTest, MountsByRequestWithTheToolDoubles) {
  ASSERT_NO_FATAL_FAILURE(Start({{"sdb1", "hfs+", ""}, {"sdc1", "hfsx", "dirty"}}, {Stick("sdb1"), Stick("sdc1")}));
  std::optional<plist::Value> reply;
  ASSERT_TRUE(daemon.SendRequest(plist::Dictionary{{"RequestType", "Mount"}, {"DeviceType", "MassStorage"},
                                                   {"DeviceNode", plist::Value("/dev/sdb1")}},
                                 &reply).ok());
  EXPECT_EQ(*reply->getString("Status"), "Success");
  EXPECT_EQ(*reply->getString("MountPath"), "/private/var/mnt/mount1");
  EXPECT_TRUE(daemon.LogContains("default: Successfully mounted /var/mnt/mount1."));
  EXPECT_THAT(MountOptions(daemon.Path("/private/var/mnt/mount1")), StartsWith("/dev/sdb1 tmpfs rw,nosuid,nodev"));

  // The client command asks for read-only and prints the mount path.
  std::string output;
  EXPECT_EQ(RunProgram({BRISVALE_CTL_PATH, "--root", daemon.root(), "mount-storage", "/dev/sdc1", "--read-only"}, &output), 0);
  EXPECT_EQ(output, "/private/var/mnt/mount2\n");
  EXPECT_TRUE(daemon.LogContains("debug: The filesystem at /dev/sdc1 appears to be dirty."));
  EXPECT_THAT(MountOptions(daemon.Path("/private/var/mnt/mount2")), StartsWith("/dev/sdc1 tmpfs ro,nosuid,nodev"));
}

TEST_F(MediaTest, SticksAndCamerasArePluggedAnnouncedListedAndSticksTakenAwayWhenPulled) {
  ASSERT_NO_FATAL_FAILURE(Start({{"sdb2", "hfs+", "dirty"}, {"sdc1", "hfsx", ""}, {"sdd1", "fat", ""}},
                                {PartitionedStick("sdb"), Stick("sdc1"), Stick("sdd1"), Camera("camera-a", 0x14100000),
                                 Camera("other", 0x14400000, 2), Camera("camera-b", 0x14200000),
                                 Camera("camera-c", std::nullopt)}));
  std::string error;
  const auto subscriber = notify::Subscriber::Create(daemon.Path("/private/var/run/vexa/notify"), &error);
  ASSERT_TRUE(subscriber) << error;
  // The notifications that arrived within a short while, with their payloads.
  const auto received = [&] {
    std::vector<std::pair<std::string, plist::Value>> all;
    while (auto n = subscriber->Receive(300ms)) all.emplace_back(n->name, n->userInfo ? plist::Value(*n->userInfo) : plist::Value());
    return all;
  };
  const auto camera = [](int64_t location) {
    return std::pair{std::string("com.vantrel.mobile.camera_attached"),
                     plist::Value(plist::Dictionary{{"LocationID", plist::Value::Int(location)},
                                                    {"DeviceType", plist::Value("PTPCamera")}})};
  };
  const std::pair<std::string, plist::Value> mounted{"com.vantrel.brisvale_mounted", plist::Value()};
  ASSERT_TRUE(daemon.PostHardwareEvent("com.vantrel.mobile.ptp_camera").ok());
  ASSERT_TRUE(daemon.PostHardwareEvent("com.vantrel.brisvale_mounter.attached").ok());
  ASSERT_TRUE(daemon.WaitForLogLine("default: Successfully mounted /var/mnt/mount2."));

  // Each camera is announced (two mounts and the FAT stick's record follow); the list
  // holds the last one found.
  EXPECT_EQ(received(), (std::vector{camera(0x14100000), camera(0x14200000), mounted, mounted, mounted}));
  EXPECT_TRUE(daemon.LogContains("default: Failed to retrieve locationID."));
  EXPECT_EQ(ListedDevice(daemon, "PTPNode"), *camera(0x14200000).second.dictionary());
  EXPECT_TRUE(daemon.LogContains("debug: The attached media sdb is not a leaf, ignoring."));
  EXPECT_TRUE(daemon.LogContains("debug: Successfully repaired /dev/sdb2."));
  EXPECT_THAT(MountOptions(daemon.Path("/private/var/mnt/mount1")), StartsWith("/dev/sdb2 "));
  EXPECT_EQ(*ListedDevice(daemon, "/dev/sdc1").value_or(plist::Dictionary{}).find("MountPath"),
            plist::Value("/private/var/mnt/mount2"));
  EXPECT_TRUE(ListedDevice(daemon, "/dev/sdd1")) << "a FAT stick is listed though not mounted";

  // A second event finds the sticks mounted and mounts nothing; the FAT stick, which is
  // not in the mount table, is recorded again.
  ASSERT_TRUE(daemon.PostHardwareEvent("com.vantrel.brisvale_mounter.attached").ok());
  ASSERT_TRUE(daemon.WaitForLogLine("default: /dev/sdc1 is already mounted."));
  EXPECT_EQ(received(), std::vector{mounted});

  // Pulled without an eject: only that stick's mount and mount point go.
  WriteDevices({Stick("sdc1"), Stick("sdd1")});
  ASSERT_TRUE(daemon.PostHardwareEvent("com.vantrel.brisvale_mounter.detached").ok());
  ASSERT_TRUE(daemon.WaitForLogLine("default: Posting notification: com.vantrel.brisvale_unmounted"));
  EXPECT_EQ(received(), (std::vector{std::pair{std::string("com.vantrel.brisvale_unmounted"), plist::Value()}}));
  EXPECT_FALSE(std::filesystem::exists(daemon.Path("/private/var/mnt/mount1")));
  EXPECT_EQ(MountOptions(daemon.Path("/private/var/mnt/mount1")), "");
  EXPECT_NE(MountOptions(daemon.Path("/private/var/mnt/mount2")), "");
  EXPECT_FALSE(ListedDevice(daemon, "/dev/sdb2"));
}

// The console agent, `brisvalectl alert-agent`, shows each alert, answers on Enter, and
// reports the alert of a stick pulled out while it is up as cancelled.
TEST_F(MediaTest, UnusableSticksRaiseTheirAlertsThroughTheAgent) {
  ASSERT_NO_FATAL_FAILURE(Start({{"sde1", "ntfs", ""}, {"sdf1", "hfs+", "broken"}}, {}));
  const std::string agentOutput = daemon.Path("/agent.out");
  int keyboard[2];
  ASSERT_EQ(pipe2(keyboard, O_CLOEXEC), 0);
  const pid_t agent = fork();
  ASSERT_GE(agent, 0);
  if (agent == 0) {
    dup2(keyboard[0], STDIN_FILENO);
    if (freopen(agentOutput.c_str(), "w", stdout)) {
      execl(BRISVALE_CTL_PATH, BRISVALE_CTL_PATH, "--root", daemon.root().c_str(), "--json", "alert-agent", nullptr);
    }
    _exit(127);
  }
  close(keyboard[0]);
  const UniqueFd enter(keyboard[1]);
  EXPECT_TRUE(WaitForText(agentOutput, "\"event\": \"listening\""));
  WriteDevices({Stick("sde1")});
  ASSERT_TRUE(daemon.PostHardwareEvent("com.vantrel.brisvale_mounter.attached").ok());
  EXPECT_TRUE(daemon.WaitForLogLine("default: Failed to mount /dev/sde1."));
  EXPECT_TRUE(WaitForText(agentOutput, "\"title\": \"Cannot Use Storage Device\""));
  EXPECT_TRUE(WaitForText(agentOutput, "\"button\": \"OK\""));
  ASSERT_EQ(write(enter.get(), "\n", 1), 1);
  EXPECT_TRUE(WaitForText(agentOutput, "\"event\": \"answered\""));

  WriteDevices({Stick("sdf1")});
  ASSERT_TRUE(daemon.PostHardwareEvent("com.vantrel.brisvale_mounter.attached").ok());
  EXPECT_TRUE(daemon.WaitForLogLine("default: Failed to mount /dev/sdf1: verification failed"));
  EXPECT_TRUE(WaitForText(agentOutput, "\"title\": \"Storage Device Needs Repair\""));
  WriteDevices({});
  ASSERT_TRUE(daemon.PostHardwareEvent("com.vantrel.brisvale_mounter.detached").ok());
  EXPECT_TRUE(WaitForText(agentOutput, "\"event\": \"cancelled\""));
  kill(agent, SIGTERM);
  waitpid(agent, nullptr, 0);
}

}  // namespace
}  // namespace brisvale::testing
