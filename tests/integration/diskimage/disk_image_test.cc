// Verified disk images through the real daemon in a sandbox root: images built with
// mkfs.ext4 and signed with brisvale-imgtool at test time, real loop devices and mounts.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <thread>

#include "loop_mount.h"
#include "platform/linux/notify_center.h"
#include "platform/os.h"
#include "plist_printers.h"
#include "sandbox_daemon.h"
#include "test_files.h"

namespace brisvale::testing {
namespace {

namespace fs = std::filesystem;
using ::testing::IsEmpty;

const std::string kPki = BRISVALE_PKI_DIR;
const std::vector<std::string> kDevice = {"--nonce", "00112233445566778899aabbccddeeff", "--board", "8",
                                          "--chip", "0x8030", "--ecid", "0x1122334455667788",
                                          "--production", "true", "--security", "true"};

void WriteFile(const fs::path& path, const std::string& text) {
  fs::create_directories(path.parent_path());
  std::ofstream(path, std::ios::binary) << text;
}

void WriteVersion(const fs::path& root, const std::string& version) {
  WriteFile(root / "System/Library/Basalt/SystemVersion.plist",
            "<?xml version=\"1.0\"?><plist version=\"1.0\"><dict><key>ProductVersion</key><string>" + version +
                "</string></dict></plist>");
}

// `forThisDevice` adds the identity of the sandbox's device.
bool Imgtool(std::vector<std::string> args, bool forThisDevice = false) {
  args.insert(args.begin(), BRISVALE_IMGTOOL);
  if (forThisDevice) args.insert(args.end(), kDevice.begin(), kDevice.end());
  return RunProgram(args) == 0;
}

// Mounts below `root` other than the sandbox's own, and loop devices backed by its files.
// A device detached while the kernel still holds it open goes a moment after the reply,
// so what is found is looked at again for up to five seconds.
std::vector<std::string> LeftBehind(const std::string& root, int retries = 250) {
  std::vector<std::string> found;
  std::vector<os::MountRecord> mounts;
  os::CopyMountTable(os::SystemOs(), mounts);
  for (const os::MountRecord& mount : mounts) {
    if (!mount.mountedOn.starts_with(root + "/")) continue;
    const std::string below = mount.mountedOn.substr(root.size());
    if (!below.starts_with("/proc") && below != "/sys" && below != "/usr" && below != "/dev") found.push_back(below);
  }
  for (const auto& entry : fs::directory_iterator("/sys/block")) {
    std::ifstream backing(entry.path() / "loop/backing_file");
    std::string file;
    if (std::getline(backing, file) && file.starts_with(root)) found.push_back(file);
  }
  if (found.empty() || retries == 0) return found;
  std::this_thread::sleep_for(std::chrono::milliseconds(20));
  return LeftBehind(root, retries - 1);
}

struct DiskImageTest : ::testing::Test {
  void SetUp() override {
    BRISVALE_REQUIRE_ROOT();
    WriteVersion(daemon.root(), "21.4.1");
    fs::create_directories(daemon.Path("/System/Library/Tethra"));
    fs::create_directories(daemon.Path("/Developer"));
    fs::copy_file(kPki + "/developer-signing.pem", daemon.Path("/System/Library/Tethra/CorvexDebug.pem"));
    fs::copy_file(kPki + "/developer-ca.pem", daemon.Path("/System/Library/Tethra/CorvexCA.pem"));
    fs::create_directories(daemon.Path("/private/var/run/vexa"));
    fs::create_directories(daemon.Path("/private/var/run/staging"));
    ASSERT_TRUE(Imgtool({"identity", "-o", daemon.Path("/private/var/run/vexa/device-identity.plist"), "--hash-method",
                         "sha384"}, /*forThisDevice=*/true));
    ASSERT_TRUE(daemon.Start());
    std::string error;
    subscriber = notify::Subscriber::Create(daemon.Path("/private/var/run/vexa/notify"), &error);
    ASSERT_TRUE(subscriber) << error;
  }
  // A new ext4 image outside the sandbox with a version file, a tool and a trust cache;
  // or, with no version, bytes no kernel file system knows.
  std::string BuildImage(const std::string& version = "21.4.5") {
    const fs::path content = work / ("content" + std::to_string(++images));
    const std::string image = (work / ("image" + std::to_string(images) + ".img")).string();
    if (version.empty()) {
      WriteFile(image, std::string(1 << 20, 'x'));
      return image;
    }
    WriteVersion(content, version);
    WriteFile(content / "usr/bin/tool", "#!/bin/sh\necho " + std::to_string(images) + "\n");
    fs::permissions(content / "usr/bin/tool", fs::perms::owner_all);
    EXPECT_TRUE(Imgtool({"trust-cache", content.string(), "-o", (content / ".TrustCache").string()}));
    std::string error;
    EXPECT_TRUE(MakeExt4Image(image, 4, content.string(), &error)) << error;
    return image;
  }

  std::string Sign(const std::string& image) {
    const std::string key = kPki + "/developer-signing.key";
    EXPECT_TRUE(Imgtool({"sign-developer", "--key", key, "--image", image, "-o", image + ".sig"}));
    return image + ".sig";
  }

  // A manifest for this device.
  std::string Manifest(const std::string& image, const std::string& subType) {
    EXPECT_TRUE(Imgtool({"manifest", "--image", image, "-o", image + ".manifest", "--sub-type", subType},
                        /*forThisDevice=*/true));
    return image + ".manifest";
  }

  // Stages a copy of `image` and asks for it to be mounted; the reply.
  plist::Value Mount(const std::string& type, const std::string& image, const std::string& signatureFile) {
    const std::string inside = "/private/var/run/staging/image.img";
    fs::copy_file(image, daemon.Path(inside));
    std::optional<plist::Value> reply;
    EXPECT_TRUE(daemon.SendRequest(plist::Dictionary{{"RequestType", "Mount"}, {"DeviceType", "DiskImage"},
                                                     {"DiskImageType", plist::Value(type)},
                                                     {"ImageSignature", plist::Value(ReadFileBytes(signatureFile))},
                                                     {"DiskImagePath", plist::Value(inside)}},
                                   &reply).ok());
    return reply.value_or(plist::Value());
  }

  std::vector<notify::Notification> Received() {
    std::vector<notify::Notification> all;
    while (auto notification = subscriber->Receive(std::chrono::milliseconds(300))) all.push_back(*notification);
    return all;
  }

  void Unmount(const std::string& mountPath) {
    daemon.SendRequest(plist::Dictionary{{"RequestType", "Unmount"}, {"MountPath", plist::Value(mountPath)}});
  }

  SandboxDaemon daemon;
  ScratchDir work;
  std::unique_ptr<notify::Subscriber> subscriber;
  int images = 0;
};

const plist::Value kFailure = plist::Dictionary{{"Status", "Failure"}};

TEST_F(DiskImageTest, ARefusedImageLeavesNothingBehindSignedAndPersonalizedOnesMount) {
  // Bytes no file system knows: attached, refused by the mount, detached again.
  const std::string garbage = BuildImage("");
  EXPECT_EQ(Mount("Developer", garbage, Sign(garbage)), kFailure);
  EXPECT_TRUE(daemon.WaitForLogLine("default: Failed to mount /private/var/run/staging/image.img at /Developer."));
  EXPECT_FALSE(fs::exists(daemon.Path("/private/var/run/staging/image.img")));  // consumed
  EXPECT_THAT(LeftBehind(daemon.root()), IsEmpty());
  EXPECT_THAT(Received(), IsEmpty());

  // brisvalectl stages the image below directories that spell its digest.
  const std::string developer = BuildImage();
  EXPECT_EQ(RunProgram({BRISVALE_CTL_PATH, "--root", daemon.root(), "mount-image", "--type", "Developer",
                        "--signature", Sign(developer), developer}), 0);
  EXPECT_TRUE(fs::exists(daemon.Path("/Developer/usr/bin/tool")));
  const auto posted = Received();
  ASSERT_EQ(posted.size(), 2u);
  EXPECT_EQ(posted[0].name, "com.vantrel.mobile.developer_image_mounted");
  EXPECT_EQ(posted[1].name, "com.vantrel.mobile.disk_image_mounted");
  EXPECT_EQ(posted[1].object, plist::Value("BrisvaleMounter"));
  EXPECT_EQ(posted[1].userInfo, (plist::Dictionary{{"DiskImageMountPath", "/Developer"}, {"DiskImageType", "Developer"}}));
  EXPECT_TRUE(posted[1].distributed);

  // A debug image is not version-checked.
  const std::string debug = BuildImage("1.0");
  EXPECT_EQ(Mount("Personalized", debug, Manifest(debug, "DebugDiskImage")),
            (plist::Dictionary{{"Status", "Success"}, {"MountPath", "/private/var/personalized_debug"}}));
  Unmount("/Developer");
  Unmount("/private/var/personalized_debug");
  EXPECT_THAT(LeftBehind(daemon.root()), IsEmpty());
}

}  // namespace
}  // namespace brisvale::testing
