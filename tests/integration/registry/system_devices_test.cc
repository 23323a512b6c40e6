// The sysfs provider against the real kernel: a loop device and
// tmpfs mounts. Needs root; every test skips itself otherwise.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>
#include <string>

#include "base/runloop.h"
#include "platform/linux/loop_device.h"
#include "platform/os.h"
#include "platform/linux/system_devices.h"
#include "test_files.h"

namespace brisvale::registry {
namespace {

using namespace std::chrono_literals;
namespace fs = std::filesystem;

constexpr const char* kIdentifier = "5D1C2E0F-7A8B-4C9D-AE1F-203142536475";

using testing::ScratchDir;

// A read-only loop device over `image`, detached again when the guard goes.
class LoopDevice {
 public:
  LoopDevice(const std::string& image, const char* identifier) {
    const int backing = open(image.c_str(), O_RDONLY | O_CLOEXEC);
    if (backing < 0) return;
    loop::AttachOptions options;
    options.autoclear = true;
    options.identifier = identifier;
    loop::Attach(backing, options, device_);
    close(backing);
  }
  void Detach() { device_.Detach(); }
  bool attached() const { return static_cast<bool>(device_); }
  std::string name() const { return device_.name(); }

 private:
  loop::LoopDevice device_;
};

std::string MakeExt4Image(const std::string& dir) {
  std::string image = dir + "/image.ext4";
  std::string command = "mkfs.ext4 -q -F " + image + " 4M >/dev/null 2>&1";
  return std::system(command.c_str()) == 0 ? image : "";
}

class SystemDevicesTest : public ::testing::Test {
 protected:
  // The media object of `name`, once the registry has it.
  ObjectRef MediaNamed(const std::string& name) {
    return model.GetMatchingService(Matching::BsdName(name));
  }

  ScratchDir dir;
  RunLoop loop;
  RegistryModel model;
};

TEST_F(SystemDevicesTest, AttachedLoopDeviceIsPublishedBelowItsDriveAndTerminatedOnDetach) {
  BRISVALE_REQUIRE_ROOT();
  std::string devRoot = dir.str() + "/dev";
  ASSERT_TRUE(fs::create_directory(devRoot));
  std::string image = MakeExt4Image(dir.str());
  ASSERT_FALSE(image.empty()) << "mkfs.ext4 failed";

  auto devices = StartSystemDevices(model, &loop, {devRoot});
  ASSERT_NE(devices, nullptr);
  auto port = model.CreateNotificationPort().value;
  port->Attach(loop);
  std::vector<ObjectRef> matched;
  auto subscription = model.AddMatchingNotification(
      *port, MatchKind::FirstMatch, Matching::Class("KxMedia"), [&](Iterator& it) {
        while (ObjectRef object = it.Next()) matched.push_back(object);
      });
  while (subscription.value->Next()) {
  }

  LoopDevice loopDevice(image, kIdentifier);
  ASSERT_TRUE(loopDevice.attached());
  // The kernel's event reaches the provider through the loop, and the new medium
  // reaches the subscriber through the port.
  ASSERT_TRUE(loop.RunUntil(
      [&] {
        return std::any_of(matched.begin(), matched.end(), [&](const ObjectRef& object) {
          return object->Property("BSD Name") == plist::Value(loopDevice.name());
        });
      },
      5s));
  ObjectRef media = MediaNamed(loopDevice.name());
  ASSERT_NE(media, nullptr);
  EXPECT_EQ(media->Property("Leaf"), plist::Value::Bool(true));
  EXPECT_EQ(media->Property("Writable"), plist::Value::Bool(false));
  EXPECT_EQ(media->Property("Removable"), plist::Value::Bool(false));
  EXPECT_EQ(media->Property("Content"), plist::Value(""));

  auto drive = media->Parent();
  ASSERT_TRUE(drive.ok());
  EXPECT_TRUE(drive.value->ConformsTo("KxNimbrelHDDriveInKernel"));
  EXPECT_EQ(drive.value->Property("image-path"),
            plist::Value(plist::Bytes(image.begin(), image.end())));
  EXPECT_EQ(SearchProperty(media, "nimbrel-unique-identifier"), plist::Value(kIdentifier));

  struct stat node;
  ASSERT_EQ(stat((devRoot + "/" + loopDevice.name()).c_str(), &node), 0)
      << "the provider makes the missing node";
  struct stat real;
  ASSERT_EQ(stat(("/dev/" + loopDevice.name()).c_str(), &real), 0);
  EXPECT_TRUE(S_ISBLK(node.st_mode));
  EXPECT_EQ(node.st_rdev, real.st_rdev);

  std::vector<uint32_t> messages;
  auto removal = model.AddInterestNotification(
      *port, media, [&](const ObjectRef&, uint32_t message) { messages.push_back(message); });
  loopDevice.Detach();
  ASSERT_TRUE(loop.RunUntil([&] { return !messages.empty(); }, 5s));
  EXPECT_EQ(messages, std::vector<uint32_t>{kMessageServiceIsTerminated});
  EXPECT_TRUE(drive.value->IsTerminated());
  EXPECT_EQ(MediaNamed(loopDevice.name()), nullptr);
}

TEST_F(SystemDevicesTest, RefreshTakesInADeviceAttachedAMomentAgo) {
  BRISVALE_REQUIRE_ROOT();
  std::string image = MakeExt4Image(dir.str());
  ASSERT_FALSE(image.empty());
  auto devices = StartSystemDevices(model, nullptr, {});  // no loop: only Refresh reads events
  ASSERT_NE(devices, nullptr);
  LoopDevice loopDevice(image, "not an identifier");
  ASSERT_TRUE(loopDevice.attached());
  // Event delivery may lag the ioctl slightly; a request a little later must see it.
  ObjectRef media;
  for (int attempt = 0; attempt < 50 && !media; ++attempt) {
    model.Refresh(RefreshReason::Request);
    media = MediaNamed(loopDevice.name());
    if (!media) usleep(20000);
  }
  ASSERT_NE(media, nullptr);
  auto drive = media->Parent();
  ASSERT_TRUE(drive.ok());
  EXPECT_EQ(drive.value->Property("nimbrel-unique-identifier"), std::nullopt)
      << "a loop device attached by someone else carries no identifier";
  loopDevice.Detach();
  for (int attempt = 0; attempt < 50 && !media->IsTerminated(); ++attempt) {
    usleep(20000);
    model.Refresh(RefreshReason::Request);
  }
  EXPECT_TRUE(media->IsTerminated());
}

}  // namespace
}  // namespace brisvale::registry
