// Removable media over the in-process registry and a fake operating system whose tools
// answer from the test: which media the attach filters let through and which alert each
// mount failure shows, check, repair and mount, how subscriptions replace each other and
// keep the process alive, how cameras are announced, what a detach unmounts, and the real
// spawn-and-wait.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <cstdlib>
#include <set>
#include <thread>

#include "base/log.h"
#include "base/runloop.h"
#include "fake_os.h"
#include "media_records.h"
#include "media/cameras.h"
#include "media/fs_check.h"
#include "media/mass_storage_mount.h"
#include "media/media_attach.h"
#include "media/media_detach.h"
#include "media/subscriptions.h"
#include "platform/ipc_service.h"
#include "platform/services.h"
#include "platform/system_notify.h"
#include "registry/registry_model.h"

namespace brisvale {
namespace {

using namespace std::chrono_literals;
using ::testing::ElementsAre;
using testing::Medium;
using Argv = std::vector<std::string>;
using Lines = std::vector<std::string>;

// Paths, spawned tools, unmounts and removals. mount_hfs mounts at the canonical
// /private/var path; the unmount of the path in `busy` is refused.
struct MediaOs : testing::FakeOs {
  std::set<std::string> existing{"/var/mnt"};
  std::vector<Argv> spawned;
  std::map<std::string, int> answers;  // "fsck_hfs -q" -> exit status
  int lastAnswer = 0;
  Lines calls;  // unmounts and removals
  std::string busy;

  int StatPath(const char* path, os::FileStatus&) override { return existing.count(path) ? 0 : -ENOENT; }
  int MakeDirectory(const char* path, uint32_t) override { return existing.insert(path).second ? 0 : -EEXIST; }
  int ChangeMode(const char*, uint32_t) override { return 0; }
  int RealPath(const char* path, std::string& resolved) override {
    resolved = std::string(path).starts_with("/var/") ? "/private" + std::string(path) : path;
    return 0;
  }
  int SpawnProgram(const Argv& argv) override {
    spawned.push_back(argv);
    const std::string tool = argv[0].substr(argv[0].rfind('/') + 1) + " " + argv[1];
    lastAnswer = answers.count(tool) ? answers[tool] : 0;
    if (tool == "mount_hfs -o" && lastAnswer == 0) {
      mounts.push_back({argv[2] == "rdonly" ? os::kMountReadOnly : 0, "hfs", "/private" + argv[4], argv[3]});
    }
    return 4242;
  }
  int WaitForChild(int, int& waitStatus) override {
    waitStatus = lastAnswer << 8;
    return 0;
  }
  int Unmount(const char* path, bool force) override {
    calls.push_back(std::string(force ? "unmount -f " : "unmount ") + path);
    return busy == path ? -EBUSY : 0;
  }
  int RemoveDirectory(const char* path) override {
    calls.push_back(std::string("rmdir ") + path);
    return 0;
  }
};

struct CountingIpc : ipc::IpcService {
  std::unique_ptr<ipc::Listener> CreateListener(std::string_view) override { return nullptr; }
  std::unique_ptr<ipc::EventStream> RegisterEventStream(std::string_view,
                                                        std::function<void(const ipc::StreamEvent&)>) override {
    return nullptr;
  }
  void BeginTransaction() override { ++count; }
  void EndTransaction() override { --count; }
  int TransactionCount() const override { return count; }
  std::atomic<int> count = 0;
};

struct RecordingNotify : notify::SystemNotify {
  void Post(const notify::Notification& notification) override {
    posted.push_back(notification.name);
    payloads.push_back(notification.userInfo);
  }
  Lines posted;
  std::vector<std::optional<plist::Dictionary>> payloads;
};

struct OneObject : registry::Iterator {
  explicit OneObject(registry::ObjectRef object) : object(std::move(object)) {}
  registry::ObjectRef Next() override { return std::exchange(object, nullptr); }
  void Reset() override {}
  bool IsValid() const override { return true; }
  registry::ObjectRef object;
};

plist::Dictionary With(plist::Dictionary properties, std::string key, std::optional<plist::Value> value) {
  if (value) properties.set(std::move(key), std::move(*value));
  else properties.erase(key);
  return properties;
}

struct MediaTest : ::testing::Test {
  MediaTest() {
    context.notificationPort = std::move(model.CreateNotificationPort().value);
    context.notificationPort->Attach(loop);
  }

  // Runs the attach handler over one medium with a mount answering the fail* flags and a
  // recording alert; the lines it logged.
  Lines Inspect(const registry::ObjectRef& medium) {
    OneObject iterator(medium);
    capture.Clear();
    const MediaMountFunction mount = [this](std::string_view, bool, bool& verificationFailed, bool& mountFailed) {
      verificationFailed = failVerification, mountFailed = failMount;
      return failVerification || failMount ? std::nullopt : std::optional<std::string>("/var/mnt/mount1");
    };
    InspectAttachedMedia(iterator, mount, [this](const char* title, const char*, const char* button,
                                                 registry::ObjectRef media) {
      alerts.push_back(std::string(title) + "/" + button + "/" + *media->Property("BSD Name")->string());
    });
    return capture.Texts();
  }

  RunLoop loop;
  registry::RegistryModel model;
  MediaOs os;
  CountingIpc ipc;
  RecordingNotify notifier;
  ScopedServices services{Services{&model, &os, &ipc, &notifier}};
  MatchingContext context;
  log::CaptureSink capture;
  registry::ObjectRef usbDisk = model.Publish(nullptr, "KxUSBHostDevice", {{"removable", plist::Value::Bool(true)}});
  Lines alerts;
  bool failVerification = false, failMount = false;
};

TEST_F(MediaTest, AttachFiltersRunInOrderAndEachFailureFlagShowsItsAlert) {
  os.mounts = {{0, "hfsplus", "/private/var/mnt/mount1", "/dev/sdm1"}};
  model.Publish(usbDisk, "KxMedia", Medium("sdm1", true));  // the medium holding that mount
  const auto gptDisk = model.Publish(usbDisk, "KxMedia", Medium("sdb", true, false, "GUID_partition_scheme"));
  const auto internal = model.Publish(nullptr, "KxAHCIDevice", {});
  const auto imageDrive = model.Publish(nullptr, "KxNimbrelHDDriveInKernel", {});
  const std::string content = "Attached media content type: Linux";
  const std::string verification = "VERIFICATION_FAILURE_TITLE/BUTTON_LABEL/", mount = "MOUNT_FAILURE_TITLE/BUTTON_LABEL/";
  enum { kVerification = 1, kMount = 2 };
  struct Case {
    registry::ObjectRef parent;
    plist::Dictionary properties;
    Lines lines;  // after the callback and "Inspecting" lines
    int fails = 0;
    Lines alerts = {};
  } cases[] = {
      // A GUID-partitioned stick delivers the whole disk, its EFI partition and its data partition.
      {usbDisk, Medium("sdb", true, false, "GUID_partition_scheme"),
       {"Attached media content type: GUID_partition_scheme", "The attached media sdb is not a leaf, ignoring."}},
      {gptDisk, Medium("sdb1", false, true, "C12A7328-F81F-11D2-BA4B-00A0C93EC93B"), {"Ignoring EFI partition."}},
      {gptDisk, Medium("sdb2", false, true, "Vantrel_partition_map"), {"Ignoring Vantrel_partition_map partition."}},
      // A partition that is not removable itself, below the removable USB disk.
      {gptDisk, Medium("sdb3", false), {content, "Attempting to mount /dev/sdb3 (read/write)"}},
      {usbDisk, With(Medium("sdc", true), "Writable", std::nullopt), {content, "Attempting to mount /dev/sdc (read only)"}},
      // Removability is judged before the leaf flag.
      {internal, Medium("vda", false, false), {content, "The attached media vda is not removable, ignoring."}},
      {usbDisk, With(Medium("sde", true), "Removable", plist::Value("yes")), {content, "Failed to retrieve Removable for sde."}},
      {usbDisk, With(Medium("sdf", true), "Leaf", std::nullopt), {content, "Failed to retrieve Leaf for sdf."}},
      {usbDisk, With(Medium("", true), "BSD Name", plist::Value::Int(7)), {"Failed to retrieve BSD Name."}},
      {usbDisk, Medium("../sda", true), {content, "Failed to create string."}},
      {usbDisk, Medium(std::string(1100, 'a'), true), {content, "Failed to create string."}},
      {usbDisk, Medium("sdm1", true), {content, "/dev/sdm1 is already mounted."}},
      {imageDrive, Medium("loop3", true), {}},  // disk images are left to their own requests
      {usbDisk, Medium("sdg1", true),
       {content, "Attempting to mount /dev/sdg1 (read/write)", "Failed to mount /dev/sdg1: verification failed"},
       kVerification, {verification + "sdg1"}},
      {usbDisk, Medium("sdi1", true),
       {content, "Attempting to mount /dev/sdi1 (read/write)", "Failed to mount /dev/sdi1: verification failed",
        "Failed to mount /dev/sdi1."},
       kVerification | kMount, {verification + "sdi1", mount + "sdi1"}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.properties.find("BSD Name")->description());
    alerts.clear();
    failVerification = c.fails & kVerification, failMount = c.fails & kMount;
    Lines expected = {"-- MEDIA ATTACHED CALLBACK --", "Inspecting the attached media."};
    expected.insert(expected.end(), c.lines.begin(), c.lines.end());
    EXPECT_EQ(Inspect(model.Publish(c.parent, "KxMedia", c.properties)), expected);
    EXPECT_EQ(alerts, c.alerts);
  }
  EXPECT_EQ(ipc.count, 0) << "the handler's own transaction ends with it";
}

// A "Mount" / "MassStorage" request through check, repair and mount: the failure flags show
// as the request's lines, the mount point as its reply.
TEST_F(MediaTest, MountRequestByNodeVolumeToolsPresentPathsAndReadOnlyValue) {
  model.Publish(usbDisk, "KxMedia", Medium("sdb1", true, true, ""));
  const std::set<std::string> four{"/var/mnt/mount1", "/var/mnt/mount2", "/var/mnt/mount3", "/var/mnt/mount4"};
  const plist::Dictionary sdb1{{"DeviceNode", plist::Value("/dev/sdb1")}};
  const std::string verification = "Failed to mount /dev/sdb1: verification issues", mount = "Failed to mount /dev/sdb1.";
  struct Case {
    std::string volume;
    std::map<std::string, int> answers;
    std::set<std::string> present;
    std::string mountPath;  // empty: the request fails
    Lines lines;            // among those logged
    plist::Dictionary request = {{"DeviceNode", plist::Value("/dev/sdb1")}};
    std::string option = "noowners";
    bool mounted = false;  // already in the mount table: refused before any tool runs
  } cases[] = {
      {"HFSX", {{"fsck_hfs -q", 3}}, {"/var/mnt/mount1"}, "/private/var/mnt/mount2",
       {"The filesystem at /dev/sdb1 appears to be dirty.", "Posting notification: com.vantrel.brisvale_mounted"}},
      {"HFS+", {}, four, "", {"Failed to determine mount path.", mount}},
      {"HFS+", {{"fsck_hfs -fy", 8}}, {}, "", {"Repairing the HFS+ filesystem at /dev/sdb1.", verification}},
      {"HFS+", {{"mount_hfs -o", 1}}, {}, "", {"Failed to mount /dev/sdb1 on /var/mnt/mount1.", mount}},
      {"NTFS", {}, {}, "", {"Unknown or unsupported filesystem at /dev/sdb1: [MSDOS_NTFS].", mount}},
      {"none", {}, {}, "", {"Unknown or unsupported filesystem at /dev/sdb1: [Unknown].", mount}},
      {"FAT", {}, {}, "/dev/sdb1", {"MSDOS FAT filesystem at /dev/sdb1. Skipping mount."}},
      {"EXFAT", {}, {}, "/dev/sdb1", {"MSDOS EXFAT filesystem at /dev/sdb1. Skipping mount."}},
      {"", {}, {}, "", {"There is no matching mass storage entry for /dev/sdz9."}, {{"DeviceNode", plist::Value("/dev/sdz9")}}},
      {"HFS+", {}, {}, "/private/var/mnt/mount1", {"Successfully mounted /var/mnt/mount1."},
       With(sdb1, "MountReadOnly", plist::Value::Bool(true)), "rdonly"},
      {"HFS+", {}, {}, "/private/var/mnt/mount1", {}, With(sdb1, "MountReadOnly", plist::Value("true"))},
      {"", {}, {}, "", {"/dev/sdb1 is already mounted."}, sdb1, "", true},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.volume + " " + plist::Value(c.request).description() + (c.lines.empty() ? "" : " " + c.lines[0]));
    os.existing = c.present, os.existing.insert("/var/mnt"), os.mounts.clear(), os.answers = c.answers;
    notifier.posted.clear(), notifier.payloads.clear(), capture.Clear(), os.volumeHeaders.clear(), os.spawned.clear();
    if (c.volume != "none") os.volumeHeaders["/dev/sdb1"] = testing::VolumeHeader(c.volume);
    if (c.mounted) os.mounts = {{0, "hfs", "/private/var/mnt/mount1", "/dev/sdb1"}};
    plist::Dictionary reply{{"Status", plist::Value("Failure")}};
    HandleMassStorageMount(plist::Value(c.request), reply);
    EXPECT_EQ(*reply.find("Status"), plist::Value(c.mountPath.empty() ? "Failure" : "Success"));
    EXPECT_EQ(reply.find("MountPath") ? *reply.find("MountPath") : plist::Value(""), plist::Value(c.mountPath));
    for (const std::string& line : c.lines) EXPECT_THAT(capture.Texts(), ::testing::Contains(line));
    EXPECT_EQ(notifier.posted, c.mountPath.empty() ? Lines{} : Lines{"com.vantrel.brisvale_mounted"});
    // FAT and exFAT never reach a tool; a mount point is made only after a passed repair.
    const bool hfs = c.volume.starts_with("HFS");
    EXPECT_EQ(os.spawned.empty(), !hfs);
    EXPECT_EQ(os.existing.size() - c.present.size() - 1, hfs && c.answers.count("fsck_hfs -fy") == 0 && c.present != four);
    if (hfs && !c.mountPath.empty()) {
      EXPECT_EQ(os.spawned.back(), (Argv{"/sbin/mount_hfs", "-o", c.option, "/dev/sdb1", c.mountPath.substr(8)}));
    }
  }
}

// Each subscription also keeps the process alive for its interval, a failed attempt too.
TEST_F(MediaTest, EachAttachEventReplacesTheSubscriptionAndKeepsTheProcessAlive) {
  BackgroundQueue queue;
  context.backgroundQueue = &queue;
  context.keepAlive = 1s;
  model.Publish(usbDisk, "KxMedia", Medium("sdb1", true));
  SubscribeMediaAttach(context);
  const registry::Iterator* first = context.mediaIterator.get();
  EXPECT_TRUE(capture.Contains(Level::Debug, "Attempting to mount /dev/sdb1 (read/write)"));

  // The next event's subscription replaces it and delivers the media again.
  capture.Clear();
  SubscribeMediaAttach(context);
  EXPECT_NE(context.mediaIterator.get(), first);
  EXPECT_TRUE(capture.Contains(Level::Debug, "Attempting to mount /dev/sdb1 (read/write)"));

  // A subscription that cannot be added logs and keeps the live one.
  const registry::Iterator* live = context.mediaIterator.get();
  auto port = std::move(context.notificationPort);
  SubscribeMediaAttach(context);
  EXPECT_EQ(context.mediaIterator.get(), live);
  EXPECT_TRUE(capture.Contains(Level::Default, "KxServiceAddMatchingNotification failed: 02bc"));
  EXPECT_EQ(ipc.count, 3);
  for (int i = 0; i < 600 && ipc.count != 0; ++i) std::this_thread::sleep_for(5ms);
  EXPECT_EQ(ipc.count, 0);
}

// Also asserted against the daemon (tests/integration/media); here the handler runs
// in-process, where coverage tools can see it.
TEST_F(MediaTest, CamerasAreAnnouncedEachAndListedOnce) {
  const auto record = [](int64_t location) {
    return plist::Dictionary{{"LocationID", plist::Value::Int(location)}, {"DeviceType", plist::Value("PTPCamera")}};
  };
  for (const auto& [protocol, location] : {std::pair{1, 0x14100000}, {2, 0x14200000}, {1, -1}, {1, 0x14300000}}) {
    plist::Dictionary interface{{"bInterfaceClass", plist::Value::Int(6)}, {"bInterfaceSubClass", plist::Value::Int(1)},
                                {"bInterfaceProtocol", plist::Value::Int(protocol)}};
    if (location >= 0) interface.set("locationID", plist::Value::Int(location));  // -1: none
    model.Publish(usbDisk, "KxUSBHostInterface", std::move(interface));
  }
  SubscribeCameraAttach(context);
  EXPECT_THAT(notifier.payloads, ElementsAre(record(0x14100000), record(0x14300000)));
  EXPECT_EQ(notifier.posted, Lines(2, "com.vantrel.mobile.camera_attached"));
  EXPECT_TRUE(capture.Contains(Level::Default, "Failed to retrieve locationID."));
  EXPECT_EQ(*CopyCameraEntries(), (plist::Dictionary{{"PTPNode", plist::Value(record(0x14300000))}}));
}

TEST_F(MediaTest, DetachUnmountsOnlyPulledMassStorage) {
  model.Publish(usbDisk, "KxMedia", Medium("sdb1", true));  // still attached
  model.Publish(model.Publish(nullptr, "KxNimbrelHDDriveInKernel", {}), "KxMedia", Medium("loop2", false));
  os.mounts = {{0, "hfsplus", "/private/var/mnt/mount1", "/dev/sdb1"},
               {0, "hfsplus", "/private/var/mnt/mount2", "/dev/sdc1"},
               {0, "hfsplus", "/private/var/mnt/mount3", "/dev/sdd1"},
               {os::kMountReadOnly, "ext4", "/private/var/personalized_debug", "/dev/loop2"}};
  os.busy = "/private/var/mnt/mount3";
  HandleMediaDetached();
  EXPECT_THAT(os.calls, ElementsAre("unmount -f /private/var/mnt/mount2", "rmdir /private/var/mnt/mount2",
                                    "unmount -f /private/var/mnt/mount3"));
  EXPECT_TRUE(capture.Contains(Level::Default, "Failed to unmount /private/var/mnt/mount3: 16"));
  EXPECT_EQ(notifier.posted, Lines{"com.vantrel.brisvale_unmounted"});

  // Entries that lack what the decision needs are logged and left alone.
  os.calls.clear();
  capture.Clear();
  UnmountPulledMedia(plist::Dictionary{
      {"/dev/sde1", plist::Value(plist::Dictionary{{"MountPath", plist::Value("/private/var/mnt/mount4")}})},
      {"/dev/sdf1", plist::Value(plist::Dictionary{{"DeviceType", plist::Value("MassStorage")}})}});
  EXPECT_TRUE(capture.Contains(Level::Default, "/dev/sde1 entry missing value for key DeviceType."));
  EXPECT_TRUE(capture.Contains(Level::Default, "/dev/sdf1 entry missing value for key MountPath."));
  EXPECT_TRUE(os.calls.empty());
}

// The real spawn and wait: an exit status passes through, a signal and a missing tool are -1.
TEST(RunToolAndWaitTest, RealToolStatuses) {
  ScopedServices services(Services{nullptr, &os::SystemOs()});
  log::CaptureSink capture;
  EXPECT_EQ(RunToolAndWait({"/bin/sh", "-c", "exit 8"}), 8);
  EXPECT_EQ(RunToolAndWait({"/bin/sh", "-c", "kill -KILL $$"}), -1);
  setenv("BRISVALE_PROBE", "inherited", 1);
  EXPECT_EQ(RunToolAndWait({"/bin/sh", "-c", "test -z \"$BRISVALE_PROBE$HOME\""}), 0);  // no environment
  EXPECT_EQ(RunToolAndWait({"/nonexistent/fsck_hfs", "-q", "/dev/x"}), -1);
  EXPECT_THAT(capture.Texts(), ElementsAre("Failed to spawn /nonexistent/fsck_hfs : 2"));
}

}  // namespace
}  // namespace brisvale
