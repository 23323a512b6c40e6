// Unmount, eject and sync over a fake operating system: each failure's exact line and
// what is left behind.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <map>

#include "base/log.h"
#include "daemon/request_handlers.h"
#include "fake_os.h"
#include "media_records.h"
#include "platform/services.h"
#include "platform/system_notify.h"
#include "registry/registry_model.h"

namespace brisvale {
namespace {

using ::testing::ElementsAre;

// Records each call; a call answers what `results` holds under its name, 0 by default.
class RecordingOs : public testing::FakeOs {
 public:
  std::map<std::string, int> results;
  std::vector<std::string> calls;

  int Record(const std::string& name, const char* path = nullptr) {
    calls.push_back(path ? name + " " + path : name);
    return results[name];
  }
  int Unmount(const char* path, bool force) override { return Record(force ? "force-unmount" : "unmount", path); }
  int RemoveDirectory(const char* path) override { return Record("rmdir", path); }
  int OpenDevice(const char* path) override {
    const int rc = Record("open", path);
    return rc < 0 ? rc : ::dup(STDIN_FILENO);  // a real descriptor, since the caller owns and closes it
  }
  int EjectDevice(int) override { return Record("eject"); }
  int SyncFilesystem(const char* path) override { return Record("sync", path); }
  int MountedDevice(const char* path, uint64_t& device) override {
    FakeOs::MountedDevice(path, device);
    return results["mounted device"];
  }
  int DeviceNumber(int, uint64_t& device) override {
    device = std::max(1, results["node device"]);
    return 0;
  }
};

class RecordingNotify : public notify::SystemNotify {
 public:
  void Post(const notify::Notification& notification) override { posted.push_back(notification.name); }
  std::vector<std::string> posted;
};

struct UnmountSyncTest : ::testing::Test {
  UnmountSyncTest() {
    os.mounts = {{0, "ext4", "/private/var/mnt/media1", "/dev/sdb1"},
                 {os::kMountReadOnly, "ext4", "/Developer", "/dev/loop2"}};
    // Known to the registry but not listed as attached media: only the mounts count.
    for (const char* name : {"sdb1", "loop2"}) {
      registry.Publish(nullptr, "KxMedia", testing::Medium(name, false, true, ""));
    }
  }

  RecordingOs os;
  RecordingNotify center;
  log::CaptureSink capture;
  registry::RegistryModel registry;
  ScopedServices services{Services{&registry, &os, nullptr, &center}};
};

// Every call the handlers make fails in turn: each failure's line, and how many calls
// ran, which pins their order too; then each request succeeds.
TEST_F(UnmountSyncTest, EachStepFailsWithItsLineAndLeavesTheRest) {
  struct Case {
    const char* name;
    void (*handler)(const plist::Value&, plist::Dictionary&);
    plist::Dictionary request;
    const char* failing;  // the call that answers `result`
    int result;
    std::string status;
    std::vector<std::string> lines;
    size_t calls;
    size_t posted;
  };
  const plist::Dictionary media1{{"MountPath", "/private/var/mnt/media1"}};
  const Case cases[] = {
      {"unmount: unknown path", HandleUnmount, {{"MountPath", "/private/var/mnt/other"}}, "", 0, "Failure",
       {"There is no matching entry in the device map for /private/var/mnt/other."}, 0, 0},
      {"unmount refused", HandleUnmount, media1, "force-unmount", -EPERM, "Failure",
       {"Failed to force unmount /private/var/mnt/media1: " + std::string(strerror(EPERM))}, 1, 0},
      {"directory not empty", HandleUnmount, media1, "rmdir", -ENOTEMPTY, "Failure",
       {"Failed to remove /private/var/mnt/media1: " + std::string(strerror(ENOTEMPTY))}, 2, 0},
      {"open fails", HandleUnmount, media1, "open", -ENOENT, "Success", {"Failed to open /dev/sdb1 : 2"}, 3, 1},
      {"eject fails", HandleUnmount, media1, "eject", -ENOTTY, "Success", {"Failed to eject /dev/sdb1 : 25"}, 4, 1},
      // The mount table's source names a device that does not hold the file system.
      {"node is another device", HandleUnmount, media1, "node device", 2, "Success",
       {"Failed to eject /dev/sdb1 : 19"}, 3, 1},
      {"no device holds the mount", HandleUnmount, media1, "mounted device", -ENODEV, "Success",
       {"Failed to eject /dev/sdb1 : 19"}, 2, 1},
      {"sync: unknown path", HandleSync, {{"MountPath", "/private/var/mnt/nothing"}}, "", 0, "Failure",
       {"There is no matching entry for /private/var/mnt/nothing."}, 0, 0},
      {"sync fails", HandleSync, media1, "sync", -EIO, "Failure",
       {"Failed to force the sync /private/var/mnt/media1: 5"}, 1, 0},
      {"sync", HandleSync, {{"MountPath", "/Developer"}}, "", 0, "Success", {}, 1, 0},
      // The developer directory is part of the system image and stays.
      {"unmount the developer directory", HandleUnmount, {{"MountPath", "/Developer"}}, "", 0, "Success", {}, 3, 1},
      {"unmount", HandleUnmount, media1, "", 0, "Success", {}, 4, 1},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    os.results = {{c.failing, c.result}};
    os.calls.clear();
    center.posted.clear();
    capture.Clear();
    plist::Dictionary reply{{"Status", "Failure"}};
    c.handler(plist::Value(c.request), reply);
    EXPECT_EQ(reply, (plist::Dictionary{{"Status", c.status}}));
    EXPECT_EQ(capture.Texts(log::Level::Default), c.lines);
    EXPECT_EQ(os.calls.size(), c.calls);
    EXPECT_EQ(center.posted.size(), c.posted);
  }
  // The last row ran every step, on the mount point and the device the mount table names.
  EXPECT_THAT(os.calls, ElementsAre("force-unmount /private/var/mnt/media1", "rmdir /private/var/mnt/media1",
                                    "open /dev/sdb1", "eject"));
  EXPECT_THAT(center.posted, ElementsAre("com.vantrel.brisvale_unmounted"));
  // The developer directory is unmounted and its loop device let go, but never removed.
  os.calls.clear();
  plist::Dictionary reply;
  HandleUnmount(plist::Value(plist::Dictionary{{"MountPath", "/Developer"}}), reply);
  EXPECT_THAT(os.calls, ElementsAre("force-unmount /Developer", "open /dev/loop2", "eject"));
}

}  // namespace
}  // namespace brisvale
