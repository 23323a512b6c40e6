// Removable media against the real daemon in a sandbox root, in one run: simulated sticks
// mounted by the client command's request, plugged and pulled by editing the devices file
// and checked and mounted by the tool doubles, the keep-alive count each event holds, a
// camera announced, and failures shown, answered and cancelled through the console alert
// agent. (The cases of each are the in-process tests', in tests/unit/media.)
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <filesystem>
#include <fstream>
#include <thread>

#include "base/unique_fd.h"
#include "platform/linux/notify_center.h"
#include "plist_printers.h"
#include "sandbox_daemon.h"

namespace brisvale::testing {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using ::testing::StartsWith;
using Notifications = std::vector<std::pair<std::string, plist::Value>>;
using Clock = std::chrono::steady_clock;

// The check and mount tool doubles at the sandbox's /sbin and the simulated `volumes`
// ({bsdName, kind, marker}) at its /dev, from scripts/doubles (which the demo uses too):
// the marker ("dirty", "broken" or none) tells the checker double what to answer.
bool PrepareSandbox(const SandboxDaemon& daemon, const std::vector<std::array<std::string, 3>>& volumes) {
  std::error_code error;
  fs::create_directories(daemon.Path("/sbin"), error);
  fs::create_directories(daemon.Path("/dev"), error);
  for (const char* tool : {"fsck_hfs", "mount_hfs"}) {
    fs::copy_file(fs::path(BRISVALE_DOUBLES_DIR) / tool, daemon.Path(std::string("/sbin/") + tool),
                  fs::copy_options::overwrite_existing, error);
    if (error) return false;
  }
  for (const auto& [bsdName, kind, marker] : volumes) {
    std::vector<std::string> argv{std::string(BRISVALE_DOUBLES_DIR) + "/make-volume",
                                  daemon.Path("/dev/" + bsdName), kind};
    if (!marker.empty()) argv.push_back(marker);
    if (RunProgram(argv) != 0) return false;
  }
  return true;
}

plist::Value UsbDevice(const std::string& name, plist::Value child) {
  return DeviceObject(name, "KxUSBHostDevice", {{"removable", plist::Value::Bool(true)}}, {std::move(child)});
}

// A USB device holding one medium that is a whole volume.
plist::Value Stick(const std::string& bsdName) {
  return UsbDevice("usb-" + bsdName, DeviceObject(bsdName, "KxMedia",
                                                  {{"BSD Name", plist::Value(bsdName)}, {"Content", plist::Value("")},
                                                   {"Removable", plist::Value::Bool(true)}, {"Leaf", plist::Value::Bool(true)},
                                                   {"Writable", plist::Value::Bool(true)}}));
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

// How long after `start` the count the daemon exports for the launcher first equals
// `expected`; none within `limit`.
std::optional<Clock::duration> TimeUntilCount(const SandboxDaemon& daemon, int32_t expected,
                                              Clock::time_point start, Clock::duration limit) {
  for (;;) {
    std::ifstream file(daemon.Path("/private/var/run/vexa/brisvale-mounterd.transactions"), std::ios::binary);
    int32_t count = -1;
    if (file.read(reinterpret_cast<char*>(&count), sizeof count) && count == expected) return Clock::now() - start;
    if (Clock::now() - start > limit) return std::nullopt;
    std::this_thread::sleep_for(5ms);
  }
}

// Waits up to two seconds for `text` in the file at `path`.
bool WaitForText(const std::string& path, const std::string& text) {
  for (int i = 0; i < 40; ++i, std::this_thread::sleep_for(50ms)) {
    std::ifstream in(path);
    if (std::string{std::istreambuf_iterator<char>(in), {}}.find(text) != std::string::npos) return true;
  }
  return false;
}

TEST(RemovableMediaTest, MountedOnRequestAndOnEventsHeldAlivePulledAndFailuresShownByTheAgent) {
  BRISVALE_REQUIRE_ROOT();
  SandboxDaemon daemon;
  const auto writeDevices = [&](plist::Array objects) {
    std::ofstream(daemon.Path("/devices.plist"))
        << plist::WriteXml(plist::Dictionary{{"Objects", plist::Value(std::move(objects))}});
  };
  ASSERT_TRUE(PrepareSandbox(daemon, {{"sdb1", "hfs+", "dirty"}, {"sdc1", "hfsx", ""}, {"sde1", "ntfs", ""},
                                      {"sdf1", "hfs+", "broken"}}));
  writeDevices({Stick("sdc1")});
  ASSERT_TRUE(daemon.Start({"--devices", "/devices.plist", "--test-keep-alive-ms", "3000"}));

  // The client command asks for a read-only mount and prints where it went.
  std::string output;
  EXPECT_EQ(RunProgram({BRISVALE_CTL_PATH, "--root", daemon.root(), "mount-storage", "/dev/sdc1", "--read-only"}, &output), 0);
  EXPECT_EQ(output, "/private/var/mnt/mount1\n");
  EXPECT_THAT(MountOptions(daemon.Path("/private/var/mnt/mount1")), StartsWith("/dev/sdc1 tmpfs ro,nosuid,nodev"));

  // Each hardware event renews a subscription, which holds one transaction for the
  // keep-alive interval (the stick is mounted already: the events find nothing to do).
  constexpr auto kInterval = 3000ms;  // long enough for both events on a loaded machine
  ASSERT_TRUE(TimeUntilCount(daemon, 0, Clock::now(), 10s));  // the start-up subscriptions' end first
  const Clock::time_point posted = Clock::now();
  ASSERT_TRUE(daemon.PostHardwareEvent("com.vantrel.brisvale_mounter.attached").ok());
  ASSERT_TRUE(daemon.PostHardwareEvent("com.vantrel.mobile.ptp_camera").ok());
  ASSERT_TRUE(TimeUntilCount(daemon, 2, posted, kInterval)) << "the count never reached 2";
  const auto fell = TimeUntilCount(daemon, 0, posted, 10 * kInterval);
  ASSERT_TRUE(fell) << "the count never fell back";
  EXPECT_GE(*fell, kInterval - 100ms) << "released before its interval";

  // Plugged in: the dirty stick is repaired and mounted read/write, the stick mounted
  // already is left alone, and the camera is announced.
  std::string error;
  const auto subscriber = notify::Subscriber::Create(daemon.Path("/private/var/run/vexa/notify"), &error);
  ASSERT_TRUE(subscriber) << error;
  const auto received = [&] {  // what arrived within a short while
    Notifications all;
    while (auto n = subscriber->Receive(300ms)) all.emplace_back(n->name, n->userInfo ? plist::Value(*n->userInfo) : plist::Value());
    return all;
  };
  const plist::Dictionary camera{{"LocationID", plist::Value::Int(0x14100000)}, {"DeviceType", plist::Value("PTPCamera")}};
  const plist::Dictionary stillImage{{"bInterfaceClass", plist::Value::Int(6)}, {"bInterfaceSubClass", plist::Value::Int(1)},
                                     {"bInterfaceProtocol", plist::Value::Int(1)}, {"locationID", plist::Value::Int(0x14100000)}};
  writeDevices({Stick("sdb1"), Stick("sdc1"),
                UsbDevice("camera", DeviceObject("ptp", "KxUSBHostInterface", stillImage))});
  ASSERT_TRUE(daemon.PostHardwareEvent("com.vantrel.mobile.ptp_camera").ok());
  ASSERT_TRUE(daemon.PostHardwareEvent("com.vantrel.brisvale_mounter.attached").ok());
  ASSERT_TRUE(daemon.WaitForLogLine("default: Successfully mounted /var/mnt/mount2."));
  EXPECT_EQ(received(), (Notifications{{"com.vantrel.mobile.camera_attached", plist::Value(camera)},
                                       {"com.vantrel.brisvale_mounted", plist::Value()}}));
  EXPECT_THAT(MountOptions(daemon.Path("/private/var/mnt/mount2")), StartsWith("/dev/sdb1 tmpfs rw,nosuid,nodev"));

  // The console agent shows each alert and answers on Enter; when every stick is pulled
  // without an eject, their mounts and mount points go and the alert still up is cancelled.
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
  writeDevices({Stick("sde1")});
  ASSERT_TRUE(daemon.PostHardwareEvent("com.vantrel.brisvale_mounter.attached").ok());
  EXPECT_TRUE(WaitForText(agentOutput, "\"title\": \"Cannot Use Storage Device\""));
  ASSERT_EQ(write(enter.get(), "\n", 1), 1);
  EXPECT_TRUE(WaitForText(agentOutput, "\"event\": \"answered\""));

  writeDevices({Stick("sdf1")});
  ASSERT_TRUE(daemon.PostHardwareEvent("com.vantrel.brisvale_mounter.attached").ok());
  EXPECT_TRUE(WaitForText(agentOutput, "\"title\": \"Storage Device Needs Repair\""));
  writeDevices({});
  ASSERT_TRUE(daemon.PostHardwareEvent("com.vantrel.brisvale_mounter.detached").ok());
  EXPECT_TRUE(WaitForText(agentOutput, "\"event\": \"cancelled\""));
  EXPECT_EQ(received(), (Notifications{{"com.vantrel.brisvale_unmounted", plist::Value()}}));
  EXPECT_TRUE(fs::is_empty(daemon.Path("/private/var/mnt")));
  kill(agent, SIGTERM);
  waitpid(agent, nullptr, 0);
}

}  // namespace
}  // namespace brisvale::testing
