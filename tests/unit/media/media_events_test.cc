// Hardware-event handling of removable media over the in-process registry and a fake
// operating system: which media the attach filters let through, which alert each mount
// failure shows, how subscriptions replace each other, what a detach unmounts, and how
// cameras are announced and listed.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <thread>

#include "base/log.h"
#include "base/runloop.h"
#include "fake_os.h"
#include "media/cameras.h"
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
using ::testing::ElementsAreArray;
using ::testing::IsEmpty;

constexpr const char* kEfi = "C12A7328-F81F-11D2-BA4B-00A0C93EC93B";

class CountingIpc : public ipc::IpcService {
 public:
  std::unique_ptr<ipc::Listener> CreateListener(std::string_view) override { return nullptr; }
  std::unique_ptr<ipc::EventStream> RegisterEventStream(
      std::string_view, std::function<void(const ipc::StreamEvent&)>) override {
    return nullptr;
  }
  void BeginTransaction() override { ++count; }
  void EndTransaction() override { --count; }
  int TransactionCount() const override { return count; }
  std::atomic<int> count = 0;
};

class RecordingNotify : public notify::SystemNotify {
 public:
  void Post(const notify::Notification& notification) override { posted.push_back(notification); }
  std::vector<notify::Notification> posted;
};

// Records unmounts and removals; a path in `busy` refuses the unmount.
class DetachOs : public testing::FakeOs {
 public:
  int Unmount(const char* path, bool force) override {
    calls.push_back(std::string(force ? "unmount -f " : "unmount ") + path);
    return busy == path ? -EBUSY : 0;
  }
  int RemoveDirectory(const char* path) override {
    calls.push_back(std::string("rmdir ") + path);
    return 0;
  }
  std::vector<std::string> calls;
  std::string busy;
};

class OneObject : public registry::Iterator {
 public:
  explicit OneObject(registry::ObjectRef object) : object_(std::move(object)) {}
  registry::ObjectRef Next() override { return std::exchange(object_, nullptr); }
  void Reset() override {}
  bool IsValid() const override { return true; }

 private:
  registry::ObjectRef object_;
};

plist::Dictionary Medium(std::string bsdName, bool removable, bool leaf = true) {
  return {{"BSD Name", plist::Value(std::move(bsdName))},
          {"Content", plist::Value("Linux")},
          {"Removable", plist::Value::Bool(removable)},
          {"Leaf", plist::Value::Bool(leaf)},
          {"Writable", plist::Value::Bool(true)}};
}

plist::Dictionary With(plist::Dictionary properties, std::string key, std::optional<plist::Value> value) {
  if (value) properties.set(std::move(key), std::move(*value));
  else properties.erase(key);
  return properties;
}

class MediaEventsTest : public ::testing::Test {
 protected:
  MediaEventsTest() : services_(Services{&model, &os, &ipc, &notifier}) {
    log::SetDebugEnabled(true);
    usbDisk = model.Publish(nullptr, "KxUSBHostDevice", {{"removable", plist::Value::Bool(true)}});
    internal = model.Publish(nullptr, "KxAHCIDevice", {});
    context.notificationPort = std::move(model.CreateNotificationPort().value);
    context.notificationPort->Attach(loop);
  }
  ~MediaEventsTest() override { log::SetDebugEnabled(false); }

  // Runs the handler over one object with a recording mount that answers `mountResult`.
  std::vector<std::string> Inspect(const registry::ObjectRef& object) {
    OneObject iterator(object);
    capture.Clear();
    InspectAttachedMedia(iterator, RecordingMount(), RecordingAlert());
    return capture.Texts();
  }
  MediaMountFunction RecordingMount() {
    return [this](std::string_view node, bool readOnly, bool& verificationFailed, bool& mountFailed) {
      mounted.push_back(std::string(node) + (readOnly ? " ro" : " rw"));
      verificationFailed = failVerification;
      mountFailed = failMount;
      return failVerification || failMount ? std::nullopt : std::optional<std::string>("/var/mnt/mount1");
    };
  }
  MediaAlertFunction RecordingAlert() {
    return [this](const char* title, const char*, const char* button, registry::ObjectRef media) {
      alerts.push_back(std::string(title) + "/" + button + "/" +
                       *media->Property("BSD Name")->string());
    };
  }
  registry::ObjectRef Camera(int64_t protocol, std::optional<int64_t> location) {
    plist::Dictionary properties{{"bInterfaceClass", plist::Value::Int(6)},
                                 {"bInterfaceSubClass", plist::Value::Int(1)},
                                 {"bInterfaceProtocol", plist::Value::Int(protocol)}};
    if (location) properties.set("locationID", plist::Value::Int(*location));
    return model.Publish(usbDisk, "KxUSBHostInterface", std::move(properties));
  }

  RunLoop loop;
  registry::RegistryModel model;
  DetachOs os;
  CountingIpc ipc;
  RecordingNotify notifier;
  MatchingContext context;
  log::CaptureSink capture;
  registry::ObjectRef usbDisk, internal;
  std::vector<std::string> mounted, alerts;
  bool failVerification = false, failMount = false;

 private:
  ScopedServices services_;
};

TEST_F(MediaEventsTest, AttachFiltersRunInOrderAndEachRejectionLogsOneLine) {
  os.mounts = {{0, "hfsplus", "/private/var/mnt/mount1", "/dev/sdm1"}};
  const auto alreadyMounted = model.Publish(usbDisk, "KxMedia", Medium("sdm1", true));
  auto gptDisk = model.Publish(usbDisk, "KxMedia",
                               With(Medium("sdb", true, false), "Content", plist::Value("GUID_partition_scheme")));
  auto image = model.Publish(model.Publish(nullptr, "KxNimbrelHDDriveInKernel", {}), "KxMedia", Medium("loop3", true));
  const std::string longName(1100, 'a');
  struct Case {
    registry::ObjectRef parent;
    plist::Dictionary properties;
    std::vector<std::string> lines;  // after the callback and "Inspecting" lines
    std::optional<std::string> mount;
  } cases[] = {
      {gptDisk, With(Medium("sdb1", false), "Content", plist::Value(kEfi)), {"Ignoring EFI partition."}, {}},
      {gptDisk, With(Medium("sdb2", false), "Content", plist::Value("Vantrel_partition_map")),
       {"Ignoring Vantrel_partition_map partition."}, {}},
      // A partition that is not removable itself, below the removable USB disk.
      {gptDisk, Medium("sdb3", false),
       {"Attached media content type: Linux", "Attempting to mount /dev/sdb3 (read/write)"}, "/dev/sdb3 rw"},
      {usbDisk, With(Medium("sdc", true), "Writable", std::nullopt),
       {"Attached media content type: Linux", "Attempting to mount /dev/sdc (read only)"}, "/dev/sdc ro"},
      {usbDisk, With(Medium("sdd", true), "Content", std::nullopt), {"Attempting to mount /dev/sdd (read/write)"},
       "/dev/sdd rw"},
      // Removability is judged before the leaf flag.
      {internal, Medium("vda", false, false),
       {"Attached media content type: Linux", "The attached media vda is not removable, ignoring."}, {}},
      {usbDisk, With(Medium("sde", true), "Removable", plist::Value("yes")),
       {"Attached media content type: Linux", "Failed to retrieve Removable for sde."}, {}},
      {usbDisk, With(Medium("sdf", true), "Leaf", std::nullopt),
       {"Attached media content type: Linux", "Failed to retrieve Leaf for sdf."}, {}},
      {usbDisk, With(Medium("", true), "BSD Name", plist::Value::Int(7)), {"Failed to retrieve BSD Name."}, {}},
      {usbDisk, Medium("../sda", true), {"Attached media content type: Linux", "Failed to create string."}, {}},
      {usbDisk, Medium(longName, true), {"Attached media content type: Linux", "Failed to create string."}, {}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.lines.back());
    mounted.clear();
    std::vector<std::string> expected = {"-- MEDIA ATTACHED CALLBACK --", "Inspecting the attached media."};
    expected.insert(expected.end(), c.lines.begin(), c.lines.end());
    EXPECT_THAT(Inspect(model.Publish(c.parent, "KxMedia", c.properties)), ElementsAreArray(expected));
    EXPECT_EQ(mounted, c.mount ? std::vector{*c.mount} : std::vector<std::string>{});
  }
  EXPECT_THAT(Inspect(alreadyMounted),
              ElementsAre("-- MEDIA ATTACHED CALLBACK --", "Inspecting the attached media.",
                          "Attached media content type: Linux", "/dev/sdm1 is already mounted."));
  EXPECT_THAT(mounted, IsEmpty());
  EXPECT_THAT(Inspect(image), ElementsAre("-- MEDIA ATTACHED CALLBACK --", "Inspecting the attached media."));
  EXPECT_EQ(ipc.count, 0) << "the handler's own transaction ends with it";
}

TEST_F(MediaEventsTest, EachFailureFlagShowsItsAlert) {
  const auto stick = model.Publish(usbDisk, "KxMedia", Medium("sdb1", true));
  struct Case {
    bool verification, mount;
    std::vector<std::string> alerts;
    std::vector<std::string> lines;
  } cases[] = {
      {false, false, {}, {}},
      {true, false, {"VERIFICATION_FAILURE_TITLE/BUTTON_LABEL/sdb1"}, {"Failed to mount /dev/sdb1: verification failed"}},
      {false, true, {"MOUNT_FAILURE_TITLE/BUTTON_LABEL/sdb1"}, {"Failed to mount /dev/sdb1."}},
      {true, true,
       {"VERIFICATION_FAILURE_TITLE/BUTTON_LABEL/sdb1", "MOUNT_FAILURE_TITLE/BUTTON_LABEL/sdb1"},
       {"Failed to mount /dev/sdb1: verification failed", "Failed to mount /dev/sdb1."}},
  };
  for (const Case& c : cases) {
    alerts.clear();
    failVerification = c.verification, failMount = c.mount;
    std::vector<std::string> lines = Inspect(stick);
    lines.erase(lines.begin(), lines.begin() + 5);  // up to the attempt
    EXPECT_EQ(lines, c.lines);
    EXPECT_EQ(alerts, c.alerts);
  }
}

TEST_F(MediaEventsTest, EachAttachEventReplacesTheSubscriptionAndSkipsMountedMedia) {
  model.Publish(usbDisk, "KxMedia", Medium("sdb1", true));
  SubscribeMediaAttach(context);
  const registry::Iterator* first = context.mediaIterator.get();
  EXPECT_TRUE(capture.Contains(Level::Debug, "Attempting to mount /dev/sdb1 (read/write)"));

  // The first run's mount is in the mount table when the second event comes.
  os.mounts = {{0, "hfsplus", "/private/var/mnt/mount1", "/dev/sdb1"}};
  capture.Clear();
  SubscribeMediaAttach(context);
  EXPECT_NE(context.mediaIterator.get(), first);
  EXPECT_TRUE(capture.Contains(Level::Default, "/dev/sdb1 is already mounted."));

  // Only the newest subscription still delivers: a medium arriving now is inspected once.
  capture.Clear();
  model.Publish(usbDisk, "KxMedia", Medium("sdc1", true));
  loop.RunFor(20ms);
  const auto texts = capture.Texts();
  EXPECT_EQ(std::count(texts.begin(), texts.end(), "Inspecting the attached media."), 1);

  // A subscription that cannot be added logs and keeps the live one.
  const registry::Iterator* live = context.mediaIterator.get();
  auto port = std::move(context.notificationPort);
  SubscribeMediaAttach(context);
  EXPECT_EQ(context.mediaIterator.get(), live);
  EXPECT_TRUE(capture.Contains(Level::Default, "KxServiceAddMatchingNotification failed: 02bc"));
}

TEST_F(MediaEventsTest, EverySubscriptionKeepsTheProcessAliveForItsInterval) {
  BackgroundQueue queue;
  context.backgroundQueue = &queue;
  context.keepAlive = 100ms;
  SubscribeCameraAttach(context);
  context.notificationPort.reset();  // a failed attempt holds one too
  SubscribeMediaAttach(context);
  EXPECT_EQ(ipc.count, 2);
  for (int i = 0; i < 400 && ipc.count != 0; ++i) std::this_thread::sleep_for(5ms);
  EXPECT_EQ(ipc.count, 0);
}

TEST_F(MediaEventsTest, CamerasAreAnnouncedEachAndListedOnce) {
  EXPECT_THAT(*CopyCameraEntries(), IsEmpty());
  Camera(1, 0x14100000);
  Camera(2, 0x14200000);  // not a still-image interface
  Camera(1, std::nullopt);
  Camera(1, 0x14300000);
  SubscribeCameraAttach(context);

  std::vector<plist::Value> locations;
  for (const notify::Notification& posted : notifier.posted) {
    EXPECT_EQ(posted.name, "com.vantrel.mobile.camera_attached");
    ASSERT_TRUE(posted.userInfo);
    EXPECT_EQ(*posted.userInfo->find("DeviceType"), plist::Value("PTPCamera"));
    locations.push_back(*posted.userInfo->find("LocationID"));
  }
  EXPECT_THAT(locations, ElementsAre(plist::Value::Int(0x14100000), plist::Value::Int(0x14300000)));
  EXPECT_TRUE(capture.Contains(Level::Default, "Failed to retrieve locationID."));

  const plist::Dictionary cameras = *CopyCameraEntries();
  EXPECT_EQ(cameras.size(), 1u);
  EXPECT_EQ(*cameras.find("PTPNode"), plist::Value(plist::Dictionary{
                                          {"LocationID", plist::Value::Int(0x14300000)},
                                          {"DeviceType", plist::Value("PTPCamera")}}));
}

TEST_F(MediaEventsTest, DetachUnmountsOnlyPulledMassStorage) {
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
  ASSERT_EQ(notifier.posted.size(), 1u);
  EXPECT_EQ(notifier.posted[0].name, "com.vantrel.brisvale_unmounted");

  // Entries that lack what the decision needs are logged and left alone.
  os.calls.clear();
  capture.Clear();
  UnmountPulledMedia(plist::Dictionary{
      {"/dev/sde1", plist::Value(plist::Dictionary{{"MountPath", plist::Value("/private/var/mnt/mount4")}})},
      {"/dev/sdf1", plist::Value(plist::Dictionary{{"DeviceType", plist::Value("MassStorage")}})}});
  EXPECT_TRUE(capture.Contains(Level::Default, "/dev/sde1 entry missing value for key DeviceType."));
  EXPECT_TRUE(capture.Contains(Level::Default, "/dev/sdf1 entry missing value for key MountPath."));
  EXPECT_THAT(os.calls, IsEmpty());
}

}  // namespace
}  // namespace brisvale
