// The loop-device helper, the sysfs device provider, the disk-image controller, the
// code-integrity service and the image volume mount over real files, loop devices and
// mounts, and the start-up clean-up of the devices a killed daemon left attached.
// Needs root; every test skips otherwise.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <sys/sysmacros.h>

#include <cstring>
#include <filesystem>
#include <fstream>

#include "base/log.h"
#include "base/plist.h"
#include "base/runloop.h"
#include "base/unique_fd.h"
#include "diskimage/attach.h"
#include "diskimage/trust_cache.h"
#include "diskimage/volume_mount.h"
#include "loop_mount.h"
#include "platform/linux/format_attach_request.h"
#include "platform/linux/format_trust_cache.h"
#include "platform/linux/loop_device.h"
#include "platform/linux/registry_disk_images.h"
#include "platform/linux/system_devices.h"
#include "platform/os.h"
#include "platform/services.h"
#include "test_files.h"

namespace brisvale::registry {
namespace {

using namespace std::chrono_literals;
namespace fs = std::filesystem;

// The first line of a sysfs attribute.
std::string ReadText(const std::string& path) {
  std::string line;
  std::getline(std::ifstream(path), line);
  return line;
}

// Unmounts what a test mounted at `mountPoint` and detaches the image devices the
// controller attached below `dir` when the test ends, however it ends.
struct ImageDevicesOwner {
  std::string dir, mountPoint;
  ~ImageDevicesOwner() {
    umount2(mountPoint.c_str(), MNT_DETACH);
    DetachAbandonedImageDevices(dir);
  }
};

class DriversTest : public ::testing::Test {
 protected:
  void SetUp() override {
    BRISVALE_REQUIRE_ROOT();
    fs::create_directories(devRoot);
    fs::create_directories(owner.mountPoint);
    // The device root holds loop-control only: the loop nodes are made on demand.
    ASSERT_EQ(mknod((devRoot + "/loop-control").c_str(), S_IFCHR | 0600, makedev(10, 237)), 0);
    std::string error;
    ASSERT_TRUE(brisvale::testing::MakeExt4Image(image, 4, "", &error)) << error;
    devices = StartSystemDevices(model, &loop, {devRoot});
    ASSERT_NE(devices, nullptr);
    services.emplace(model, DiskImageServicesOptions{devRoot, dir.str() + "/trust-caches",
                                                     [this] { devices->Rescan(); }});
  }

  // Loop devices whose backing file lies in this test's directory.
  int AttachedUnderDir() const {
    int count = 0;
    for (const auto& entry : fs::directory_iterator("/sys/block")) {
      if (ReadText(entry.path().string() + "/loop/backing_file").starts_with(dir.str() + "/")) ++count;
    }
    return count;
  }

  // Calls the controller's attach method the way the daemon does, with a record that
  // points at the serialized list (or as `damage` alters it).
  Status Attach(const plist::Dictionary& list, const std::function<void(std::vector<uint8_t>&)>& damage = {}) {
    const std::string xml = plist::WriteXml(plist::Value(list));
    std::vector<uint8_t> record(formats::kAttachRecordSize);
    const uint32_t header[2] = {formats::kAttachRecordMagic, formats::kAttachRecordVersion};
    const uint64_t location[2] = {reinterpret_cast<uintptr_t>(xml.data()), xml.size()};
    std::memcpy(record.data(), header, sizeof header);
    std::memcpy(record.data() + 8, location, sizeof location);
    if (damage) damage(record);
    auto client = model.Open(model.GetMatchingService(Matching::Class("KxNimbrelController")), 0);
    if (!client.ok()) return client.status;
    MethodArgs args;
    args.structIn = record;
    args.structOutCapacity = 4;
    return client.value->CallMethod(0, args);
  }

  static plist::Dictionary List(const std::string& identifier, const std::string& path) {
    return {{"nimbrel-unique-identifier", plist::Value(identifier)},
            {"image-path", plist::Value(plist::Bytes(path.begin(), path.end()))}};
  }

  // The BSD name of the medium published for `identifier`.
  static std::string MediumOf(const std::string& identifier) { return FindAttachedMedia(identifier).value_or(""); }

  brisvale::testing::ScratchDir dir;
  const std::string devRoot = dir.str() + "/dev", image = dir.str() + "/image.ext4";
  ImageDevicesOwner owner{dir.str(), dir.str() + "/mnt"};
  RunLoop loop;
  RegistryModel model;
  ScopedServices scoped{Services{&model, &os::SystemOs()}};
  std::unique_ptr<SystemDevices> devices;
  std::optional<DiskImageServices> services;
};

constexpr const char* kId1 = "0F3C2B1A-9D8E-4F7A-B6C5-D4E3F2A1B0C9";
constexpr const char* kId2 = "1A2B3C4D-5E6F-4071-8293-A4B5C6D7E8F9";

TEST_F(DriversTest, AttachPublishesBeforeReturningAndRefusesWhatItDidNotVerify) {
  struct stat verified {};
  ASSERT_EQ(stat(image.c_str(), &verified), 0);
  plist::Dictionary list = List(kId1, image);
  list.set("image-device", plist::Value::UInt(verified.st_dev));
  list.set("image-inode", plist::Value::UInt(verified.st_ino));
  ASSERT_EQ(Attach(list), kSuccess);
  const std::string medium = MediumOf(kId1);
  ASSERT_FALSE(medium.empty());
  EXPECT_EQ(ReadText("/sys/block/" + medium + "/ro"), "1");
  EXPECT_TRUE(fs::is_block_file(devRoot + "/" + medium));

  // Refusals: each with its line, none attaching anything.
  const std::string other = dir.str() + "/other.ext4", link = dir.str() + "/link", fifo = dir.str() + "/fifo";
  fs::copy_file(image, other);
  fs::create_symlink(image, link);
  ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0);
  plist::Dictionary swapped = list;
  swapped.set("image-path", plist::Value(plist::Bytes(other.begin(), other.end())));
  struct Case {
    plist::Dictionary list;
    std::function<void(std::vector<uint8_t>&)> damage;
    Status status;
    std::string line;
  } cases[] = {
      {swapped, {}, 0xe00002e2, "Disk image " + other + " is not the file that was verified."},
      {List(kId2, link), {}, kNotFound, "Failed to open disk image " + link + ": 40"},
      {List(kId2, fifo), {}, kBadArgument, "Disk image " + fifo + " is not a regular file."},
      {List(kId2, "image.ext4"), {}, kBadArgument, "Disk image attach refused: bad image path."},
      {List("not-a-uuid", image), {}, kBadArgument, "Disk image attach refused: bad identifier."},
      {List(kId2, image), [](auto& record) { std::memset(record.data() + 16, 0, 8); }, kBadArgument,
       "Disk image attach refused: property list length out of range."},
      {List(kId2, image), [](auto& record) { record[0] = 0; }, kBadArgument, "Disk image attach refused: bad magic."},
      {List(kId2, image), [](auto& record) { std::memset(record.data() + 8, 0, 7); record[8] = 8; },
       kBadArgument, "Disk image attach refused: unreadable property list: 14"},
  };
  for (const Case& c : cases) {
    log::CaptureSink capture;
    EXPECT_EQ(Attach(c.list, c.damage), c.status) << c.line;
    EXPECT_EQ(capture.Texts(), std::vector{c.line});
  }
  // The verified file's read lease gone (a writer opened it): what was attached goes again.
  const UniqueFd unleased(open(image.c_str(), O_RDONLY | O_CLOEXEC));
  const VerifiedFile file{unleased.get(), verified.st_dev, verified.st_ino};
  log::CaptureSink capture;
  EXPECT_EQ(AttachAndMountImage(image, owner.mountPoint, &file), std::nullopt);
  EXPECT_TRUE(capture.Contains(log::Level::Default, image + " was opened for writing after it was verified."));
  EXPECT_EQ(AttachedUnderDir(), 1);
  // A second name for the verified file would let it be rewritten: refused too.
  fs::create_hard_link(image, dir.str() + "/second-name");
  EXPECT_EQ(Attach(list), 0xe00002e2);
  EXPECT_EQ(AttachedUnderDir(), 1);
}

TEST_F(DriversTest, TrustCachesAreKeptOrRefusedVolumesMountReadOnlyAndAMismatchUndoesAll) {
  // A malformed cache is refused; a well-formed one is kept.
  const std::string cachePath = owner.mountPoint + "/.TrustCache", keptDir = dir.str() + "/trust-caches";
  formats::TrustCacheEntry entry;
  entry.hash.fill(7);
  const std::vector<uint8_t> wellFormed = formats::BuildTrustCache({entry});
  brisvale::testing::WriteFileBytes(cachePath, {'B', 'V', 'T', 'C'});
  EXPECT_EQ(LoadTrustCache(owner.mountPoint), -1);
  brisvale::testing::WriteFileBytes(cachePath, wellFormed);
  EXPECT_EQ(LoadTrustCache(owner.mountPoint), 0);
  ASSERT_EQ(std::distance(fs::directory_iterator(keptDir), fs::directory_iterator()), 1);
  EXPECT_EQ(brisvale::testing::ReadFileBytes(fs::directory_iterator(keptDir)->path()), wellFormed);

  // Read-only, without set-user-ID programs or device nodes.
  ASSERT_EQ(Attach(List(kId1, image)), kSuccess);
  const std::string medium = MediumOf(kId1);
  ASSERT_FALSE(medium.empty());
  os::VolumeMountArguments arguments;
  arguments.devicePath = "/dev/" + medium;
  ASSERT_EQ(os::SystemOs().MountVolume("hfs", owner.mountPoint.c_str(), os::kMountReadOnly, arguments), 0);
  struct statvfs volume {};
  ASSERT_EQ(statvfs(owner.mountPoint.c_str(), &volume), 0);
  EXPECT_EQ(volume.f_flag & (ST_RDONLY | ST_NOSUID | ST_NODEV), ST_RDONLY | ST_NOSUID | ST_NODEV);
  ASSERT_EQ(umount2(owner.mountPoint.c_str(), 0), 0);

  // The host has no system version file, so the check fails and everything goes again.
  log::CaptureSink capture;
  EXPECT_EQ(MountImageVolume(medium, owner.mountPoint), std::nullopt);
  EXPECT_EQ(capture.Texts().back(), "System version verification failed for " + owner.mountPoint + ".");
  EXPECT_TRUE(fs::exists(cachePath)) << "still mounted over";
  EXPECT_EQ(AttachedUnderDir(), 0);
}

TEST_F(DriversTest, StartUpDetachesOnlyUnmountedImageDevicesOfItsRoot) {
  const std::string second = dir.str() + "/second.ext4";
  fs::copy_file(image, second);
  ASSERT_EQ(Attach(List(kId1, image)), kSuccess);
  ASSERT_EQ(Attach(List(kId2, second)), kSuccess);
  const std::string mounted = MediumOf(kId1);
  ASSERT_EQ(mount(("/dev/" + mounted).c_str(), owner.mountPoint.c_str(), "ext4", MS_RDONLY, nullptr), 0);
  EXPECT_EQ(DetachAbandonedImageDevices(dir.str() + "/elsewhere"), 0);
  EXPECT_EQ(DetachAbandonedImageDevices(dir.str()), 1);
  EXPECT_EQ(AttachedUnderDir(), 1);
  EXPECT_EQ(ReadText("/sys/block/" + mounted + "/loop/backing_file"), image);
}

TEST_F(DriversTest, LoopHelperDevicesArePublishedBelowTheirDriveThroughEventsOrARefresh) {
  auto port = model.CreateNotificationPort().value;
  port->Attach(loop);
  std::vector<std::optional<plist::Value>> matched;  // BSD names
  const auto collect = [&](Iterator& it) {
    while (ObjectRef object = it.Next()) matched.push_back(object->Property("BSD Name"));
  };
  auto subscription = model.AddMatchingNotification(*port, MatchKind::FirstMatch, Matching::Class("KxMedia"), collect);
  collect(*subscription.value);
  // Through the loop helper: read-only, partitions scanned, named, its node made only
  // for the open.
  const auto attach = [&](const char* identifier, bool legacy, loop::LoopDevice& device) {
    const UniqueFd backing(open(image.c_str(), O_RDONLY | O_CLOEXEC));
    loop::AttachOptions options;
    options.partitionScan = true;
    options.identifier = identifier;
    options.deviceRoot = devRoot;
    options.legacyAttach = legacy;
    ASSERT_EQ(loop::Attach(backing.get(), options, device), 0);
    const std::string sys = "/sys/block/" + device.name();
    EXPECT_EQ(ReadText(sys + "/ro"), "1");
    EXPECT_EQ(ReadText(sys + "/loop/partscan"), "1");
    EXPECT_EQ(ReadText(sys + "/loop/backing_file"), image);
    std::string stored;
    EXPECT_TRUE(loop::ReadIdentifier(device.fd(), stored) == 0 && stored == identifier);
  };

  loop::LoopDevice device;
  ASSERT_NO_FATAL_FAILURE(attach(kId1, /*legacy=*/false, device));
  EXPECT_FALSE(fs::exists(devRoot + "/" + device.name()));
  // The kernel's event reaches the provider through the loop, and the new medium
  // reaches the subscriber through the port.
  ASSERT_TRUE(loop.RunUntil([&] { return std::ranges::count(matched, plist::Value(device.name())) == 1; }, 5s));
  ObjectRef media = model.GetMatchingService(Matching::BsdName(device.name()));
  ASSERT_NE(media, nullptr);
  EXPECT_EQ(media->Property("Leaf"), plist::Value::Bool(true));
  EXPECT_EQ(media->Property("Writable"), plist::Value::Bool(false));
  EXPECT_EQ(media->Property("Removable"), plist::Value::Bool(false));
  EXPECT_EQ(media->Property("Content"), plist::Value(""));
  auto drive = media->Parent();
  ASSERT_TRUE(drive.ok());
  EXPECT_TRUE(drive.value->ConformsTo("KxNimbrelHDDriveInKernel"));
  EXPECT_EQ(drive.value->Property("image-path"), plist::Value(plist::Bytes(image.begin(), image.end())));
  EXPECT_EQ(SearchProperty(media, "nimbrel-unique-identifier"), plist::Value(kId1));

  std::vector<uint32_t> messages;
  auto removal = model.AddInterestNotification(
      *port, media, [&](const ObjectRef&, uint32_t message) { messages.push_back(message); });
  device.Detach();
  ASSERT_TRUE(loop.RunUntil([&] { return !messages.empty(); }, 5s));
  EXPECT_EQ(messages, std::vector<uint32_t>{kMessageServiceIsTerminated});
  EXPECT_TRUE(drive.value->IsTerminated());

  // Without running the loop a request's refresh reads the events itself; event delivery
  // may lag the ioctl slightly, so a request a little later must see the change.
  const auto refreshedUntil = [&](const std::function<bool()>& done) {
    for (int attempt = 0; attempt < 50 && !done(); ++attempt) {
      model.Refresh(RefreshReason::Request);
      if (!done()) usleep(20000);
    }
    return done();
  };
  {
    loop::LoopDevice other;
    ASSERT_NO_FATAL_FAILURE(attach("not an identifier", /*legacy=*/true, other));
    ASSERT_TRUE(refreshedUntil([&] { return (media = model.GetMatchingService(Matching::BsdName(other.name()))) != nullptr; }));
    EXPECT_EQ(SearchProperty(media, "nimbrel-unique-identifier"), std::nullopt)
        << "a loop device attached by someone else carries no identifier";
  }  // the helper detaches what it attached when it goes
  EXPECT_TRUE(refreshedUntil([&] { return media->IsTerminated(); }));
  EXPECT_EQ(AttachedUnderDir(), 0);
}

}  // namespace
}  // namespace brisvale::registry
