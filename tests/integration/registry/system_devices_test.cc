// The sysfs provider against the real kernel: loop devices published below their drive
// and terminated as they come and go, through the run loop's events or a refresh.
// Needs root; every test skips itself otherwise.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <string>

#include "base/runloop.h"
#include "base/unique_fd.h"
#include "loop_mount.h"
#include "platform/linux/loop_device.h"
#include "platform/linux/system_devices.h"
#include "test_files.h"

namespace brisvale::registry {
namespace {

using namespace std::chrono_literals;
namespace fs = std::filesystem;

constexpr const char* kIdentifier = "5D1C2E0F-7A8B-4C9D-AE1F-203142536475";

class SystemDevicesTest : public ::testing::Test {
 protected:
  void SetUp() override {
    BRISVALE_REQUIRE_ROOT();
    std::string error;
    ASSERT_TRUE(brisvale::testing::MakeExt4Image(image, 4, "", &error)) << error;
  }

  // Attaches the image read-only to a loop device carrying `identifier`.
  void Attach(const char* identifier) {
    const UniqueFd backing(open(image.c_str(), O_RDONLY | O_CLOEXEC));
    loop::AttachOptions options;
    options.autoclear = true;
    options.identifier = identifier;
    ASSERT_EQ(loop::Attach(backing.get(), options, device), 0);
  }

  // The media object of `name`, once the registry has it.
  ObjectRef MediaNamed(const std::string& name) { return model.GetMatchingService(Matching::BsdName(name)); }

  brisvale::testing::ScratchDir dir;
  const std::string image = dir.str() + "/image.ext4";
  RunLoop loop;
  RegistryModel model;
  loop::LoopDevice device;
};

TEST_F(SystemDevicesTest, LoopDevicesArePublishedBelowTheirDriveAndTerminatedOnDetach) {
  const std::string devRoot = dir.str() + "/dev";
  ASSERT_TRUE(fs::create_directory(devRoot));

  auto devices = StartSystemDevices(model, &loop, {devRoot});
  ASSERT_NE(devices, nullptr);
  auto port = model.CreateNotificationPort().value;
  port->Attach(loop);
  std::vector<std::optional<plist::Value>> matched;  // BSD names
  const auto collect = [&](Iterator& it) {
    while (ObjectRef object = it.Next()) matched.push_back(object->Property("BSD Name"));
  };
  auto subscription = model.AddMatchingNotification(*port, MatchKind::FirstMatch, Matching::Class("KxMedia"), collect);
  collect(*subscription.value);

  ASSERT_NO_FATAL_FAILURE(Attach(kIdentifier));
  // The kernel's event reaches the provider through the loop, and the new medium
  // reaches the subscriber through the port.
  ASSERT_TRUE(loop.RunUntil([&] { return std::ranges::count(matched, plist::Value(device.name())) == 1; }, 5s));
  ObjectRef media = MediaNamed(device.name());
  ASSERT_NE(media, nullptr);
  EXPECT_EQ(media->Property("Leaf"), plist::Value::Bool(true));
  EXPECT_EQ(media->Property("Writable"), plist::Value::Bool(false));
  EXPECT_EQ(media->Property("Removable"), plist::Value::Bool(false));
  EXPECT_EQ(media->Property("Content"), plist::Value(""));

  auto drive = media->Parent();
  ASSERT_TRUE(drive.ok());
  EXPECT_TRUE(drive.value->ConformsTo("KxNimbrelHDDriveInKernel"));
  EXPECT_EQ(drive.value->Property("image-path"), plist::Value(plist::Bytes(image.begin(), image.end())));
  EXPECT_EQ(SearchProperty(media, "nimbrel-unique-identifier"), plist::Value(kIdentifier));

  struct stat node {}, real {};
  ASSERT_EQ(stat((devRoot + "/" + device.name()).c_str(), &node), 0) << "the provider makes the missing node";
  ASSERT_EQ(stat(("/dev/" + device.name()).c_str(), &real), 0);
  EXPECT_TRUE(S_ISBLK(node.st_mode) && node.st_rdev == real.st_rdev);

  std::vector<uint32_t> messages;
  auto removal = model.AddInterestNotification(
      *port, media, [&](const ObjectRef&, uint32_t message) { messages.push_back(message); });
  device.Detach();
  ASSERT_TRUE(loop.RunUntil([&] { return !messages.empty(); }, 5s));
  EXPECT_EQ(messages, std::vector<uint32_t>{kMessageServiceIsTerminated});
  EXPECT_TRUE(drive.value->IsTerminated());
  EXPECT_EQ(MediaNamed(device.name()), nullptr);

  // Without running the loop a request's refresh reads the events itself; event delivery
  // may lag the ioctl slightly, so a request a little later must see the change.
  const auto refreshedUntil = [&](const std::function<bool()>& done) {
    for (int attempt = 0; attempt < 50 && !done(); ++attempt) {
      model.Refresh(RefreshReason::Request);
      if (!done()) usleep(20000);
    }
    return done();
  };
  ASSERT_NO_FATAL_FAILURE(Attach("not an identifier"));
  ASSERT_TRUE(refreshedUntil([&] { return (media = MediaNamed(device.name())) != nullptr; }));
  EXPECT_EQ(SearchProperty(media, "nimbrel-unique-identifier"), std::nullopt)
      << "a loop device attached by someone else carries no identifier";
  device.Detach();
  EXPECT_TRUE(refreshedUntil([&] { return media->IsTerminated(); }));
}

}  // namespace
}  // namespace brisvale::registry
