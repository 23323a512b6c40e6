// Verified disk images through the real daemon in a sandbox root: images built with
// mkfs.ext4 and signed with brisvale-imgtool at test time, real loop devices and mounts.
#include <fcntl.h>
#include <unistd.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "base/unique_fd.h"
#include "loop_mount.h"
#include "platform/linux/notify_center.h"
#include "plist_printers.h"
#include "sandbox_daemon.h"

namespace brisvale::testing {
namespace {

namespace fs = std::filesystem;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

const std::string kPki = BRISVALE_PKI_DIR;
const std::vector<std::string> kDevice = {"--nonce", "00112233445566778899aabbccddeeff", "--board", "8",
                                          "--chip", "0x8030", "--ecid", "0x1122334455667788",
                                          "--production", "true", "--security", "true"};

std::string VersionPlist(const std::string& version) {
  return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><dict><key>ProductVersion</key>"
         "<string>" + version + "</string></dict></plist>\n";
}

void WriteFile(const fs::path& path, const std::string& text) {
  fs::create_directories(path.parent_path());
  std::ofstream(path, std::ios::binary) << text;
}

bool Imgtool(std::vector<std::string> args) {
  args.insert(args.begin(), BRISVALE_IMGTOOL);
  return RunProgram(args) == 0;
}

// Mount-table lines and loop devices that belong to `root`.
std::vector<std::string> LeftBehind(const std::string& root) {
  std::vector<std::string> found;
  std::ifstream table("/proc/self/mountinfo");
  for (std::string line; std::getline(table, line);) {
    if (line.find(" " + root + "/") != std::string::npos &&
        line.find(root + "/proc") == std::string::npos && line.find(root + "/sys") == std::string::npos &&
        line.find(root + "/usr") == std::string::npos && line.find(root + "/dev") == std::string::npos) {
      found.push_back(line);
    }
  }
  for (const auto& entry : fs::directory_iterator("/sys/block")) {
    std::ifstream backing(entry.path() / "loop/backing_file");
    std::string file;
    if (std::getline(backing, file) && file.starts_with(root)) found.push_back(file);
  }
  return found;
}

// What an image carries.
struct ImageRecipe {
  std::string version = "21.4.5";
  enum class TrustCache { Real, None, Directory, Empty, Malformed } trustCache = TrustCache::Real;
  bool fileSystem = true;  // false: bytes no kernel file system knows
};

struct DiskImageTest : ::testing::Test {
  void SetUp() override {
    BRISVALE_REQUIRE_ROOT();
    work = fs::path(daemon.root() + ".work");
    fs::create_directories(work);
    WriteFile(daemon.Path("/System/Library/Basalt/SystemVersion.plist"), VersionPlist("21.4.1"));
    fs::create_directories(daemon.Path("/System/Library/Tethra"));
    fs::copy_file(kPki + "/developer-signing.pem", daemon.Path("/System/Library/Tethra/CorvexDebug.pem"));
    fs::copy_file(kPki + "/developer-ca.pem", daemon.Path("/System/Library/Tethra/CorvexCA.pem"));
    fs::create_directories(daemon.Path("/Developer"));
    std::vector<std::string> identity = {"identity", "-o", daemon.Path("/private/var/run/vexa/device-identity.plist"),
                                         "--hash-method", "sha384"};
    identity.insert(identity.end(), kDevice.begin(), kDevice.end());
    fs::create_directories(daemon.Path("/private/var/run/vexa"));
    ASSERT_TRUE(Imgtool(identity));
    ASSERT_TRUE(daemon.Start());
    std::string error;
    subscriber = notify::Subscriber::Create(daemon.Path("/private/var/run/vexa/notify"), &error);
    ASSERT_TRUE(subscriber) << error;
  }
  void TearDown() override {
    if (!work.empty()) fs::remove_all(work);
  }

  // A new image file outside the sandbox.
  std::string BuildImage(const ImageRecipe& recipe = {}) {
    const fs::path content = work / ("content" + std::to_string(++images));
    const std::string image = (work / ("image" + std::to_string(images) + ".img")).string();
    if (!recipe.fileSystem) {
      WriteFile(image, std::string(1 << 20, 'x'));
      return image;
    }
    WriteFile(content / "System/Library/Basalt/SystemVersion.plist", VersionPlist(recipe.version));
    WriteFile(content / "usr/bin/tool", "#!/bin/sh\necho " + std::to_string(images) + "\n");
    fs::permissions(content / "usr/bin/tool", fs::perms::owner_all);
    using TC = ImageRecipe::TrustCache;
    switch (recipe.trustCache) {
      case TC::Real: EXPECT_TRUE(Imgtool({"trust-cache", content.string(), "-o", (content / ".TrustCache").string()})); break;
      case TC::Directory: fs::create_directories(content / ".TrustCache"); break;
      case TC::Empty: WriteFile(content / ".TrustCache", ""); break;
      case TC::Malformed: WriteFile(content / ".TrustCache", std::string(37, '\x01')); break;
      case TC::None: break;
    }
    std::string error;
    EXPECT_TRUE(MakeExt4Image(image, 4, content.string(), &error)) << error;
    return image;
  }

  std::string Sign(const std::string& image) {
    const std::string signature = image + ".sig";
    EXPECT_TRUE(Imgtool({"sign-developer", "--key", kPki + "/developer-signing.key", "--image", image, "-o", signature}));
    return signature;
  }

  std::string Manifest(const std::string& image, const std::string& subType, std::vector<std::string> extra = {}) {
    const std::string manifest = image + "." + subType + ".manifest";
    std::vector<std::string> device = kDevice;
    for (size_t i = 0; i + 1 < extra.size(); i += 2) {  // another device's value replaces ours
      const auto option = std::find(device.begin(), device.end(), extra[i]);
      if (option != device.end()) *(option + 1) = extra[i + 1];
    }
    std::vector<std::string> args = {"manifest", "--image", image, "-o", manifest, "--sub-type", subType};
    args.insert(args.end(), device.begin(), device.end());
    EXPECT_TRUE(Imgtool(args));
    return manifest;
  }

  // Stages a copy of `image` in the sandbox and asks for it to be mounted; the reply.
  plist::Value Mount(const std::string& type, const std::string& image, const std::string& signatureFile,
                     std::string* stagedInside = nullptr) {
    const std::string inside = "/private/var/run/staging/" + std::to_string(++staged) + ".img";
    fs::create_directories(daemon.Path("/private/var/run/staging"));
    fs::copy_file(image, daemon.Path(inside));
    if (stagedInside) *stagedInside = inside;
    std::ifstream file(signatureFile, std::ios::binary);
    const plist::Bytes signature((std::istreambuf_iterator<char>(file)), std::istreambuf_iterator<char>());
    std::optional<plist::Value> reply;
    EXPECT_TRUE(daemon.SendRequest(plist::Dictionary{{"RequestType", "Mount"},
                                                     {"DeviceType", "DiskImage"},
                                                     {"DiskImageType", plist::Value(type)},
                                                     {"ImageSignature", plist::Value(signature)},
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
    std::optional<plist::Value> reply;
    daemon.SendRequest(plist::Dictionary{{"RequestType", "Unmount"}, {"MountPath", plist::Value(mountPath)}}, &reply);
  }

  SandboxDaemon daemon;
  fs::path work;
  std::unique_ptr<notify::Subscriber> subscriber;
  int images = 0, staged = 0;
};

plist::Value Success(const std::string& mountPath) {
  return plist::Dictionary{{"Status", "Success"}, {"MountPath", plist::Value(mountPath)}};
}
const plist::Value kFailure = plist::Dictionary{{"Status", "Failure"}};

TEST_F(DiskImageTest, DeveloperImageMountsIsAnnouncedListedAndConsumed) {
  const std::string image = BuildImage();
  std::string inside;
  EXPECT_EQ(Mount("Developer", image, Sign(image), &inside), Success("/Developer"));
  EXPECT_FALSE(fs::exists(daemon.Path(inside)));
  EXPECT_TRUE(fs::exists(daemon.Path("/Developer/usr/bin/tool")));

  const auto posted = Received();
  ASSERT_EQ(posted.size(), 2u);
  EXPECT_EQ(posted[0].name, "com.vantrel.mobile.developer_image_mounted");
  EXPECT_EQ(posted[1].name, "com.vantrel.mobile.disk_image_mounted");
  EXPECT_EQ(posted[1].object, plist::Value("BrisvaleMounter"));
  EXPECT_EQ(posted[1].userInfo, (plist::Dictionary{{"DiskImageMountPath", "/Developer"}, {"DiskImageType", "Developer"}}));
  EXPECT_TRUE(posted[1].distributed);

  std::optional<plist::Value> devices;
  ASSERT_TRUE(daemon.SendRequest(plist::Dictionary{{"RequestType", "CopyDevices"}}, &devices).ok());
  bool listed = false;
  for (const plist::Value& entry : *devices->get("EntryList")->array()) {
    if (const std::string* path = entry.getString("MountPath"); path && *path == "/Developer") {
      listed = true;
      EXPECT_EQ(*entry.getString("DiskImageType"), "Developer");
      EXPECT_TRUE(entry.get("ImageSignature") == nullptr || entry.get("ImageSignature")->data());
    }
  }
  EXPECT_TRUE(listed);

  // A second image at the same place is refused; the first stays.
  EXPECT_EQ(Mount("Developer", image, Sign(image)), kFailure);
  EXPECT_TRUE(daemon.LogContains("default: A disk image of type Developer/(null) is already mounted at /Developer."));
  Unmount("/Developer");
  EXPECT_THAT(LeftBehind(daemon.root()), IsEmpty());
}

TEST_F(DiskImageTest, FactoryImagesMountSideBySideAndAnIdenticalOneIsAnsweredWithItsPath) {
  const std::string first = BuildImage(), second = BuildImage();
  const plist::Value one = Mount("Factory", first, Sign(first));
  const plist::Value two = Mount("Factory", second, Sign(second));
  ASSERT_TRUE(one.getString("MountPath") && two.getString("MountPath"));
  EXPECT_NE(*one.getString("MountPath"), *two.getString("MountPath"));
  EXPECT_TRUE(one.getString("MountPath")->starts_with("/private/var/factory_mount/"));
  EXPECT_EQ(Received().size(), 4u);

  // The identical-image answer comes from the digest the staging directories spell,
  // which brisvalectl writes; a test-made copy goes through it.
  const std::string ctl = BRISVALE_CTL_PATH;
  std::string output;
  EXPECT_EQ(RunProgram({ctl, "--root", daemon.root(), "mount-image", "--type", "Factory", "--signature",
                        Sign(first), first}, &output), 0);
  EXPECT_EQ(RunProgram({ctl, "--root", daemon.root(), "mount-image", "--type", "Factory", "--signature",
                        Sign(first), first}, &output), 0);
  EXPECT_TRUE(daemon.LogContains("default: Matching image of type Factory/(null) found."));
  EXPECT_TRUE(fs::exists(first));  // the caller's file is kept
  for (const auto& entry : fs::directory_iterator(daemon.Path("/private/var/factory_mount"))) {
    Unmount(entry.path().string().substr(daemon.root().size()));
  }
  EXPECT_THAT(LeftBehind(daemon.root()), IsEmpty());
}

TEST_F(DiskImageTest, PersonalizedImagesMountWhereTheirSubTypeSays) {
  // A debug image is not version-checked; a developer one is.
  const std::string debug = BuildImage({.version = "1.0"});
  EXPECT_EQ(Mount("Personalized", debug, Manifest(debug, "DebugDiskImage")), Success("/private/var/personalized_debug"));
  const std::string developer = BuildImage();
  EXPECT_EQ(Mount("Personalized", developer, Manifest(developer, "DeveloperDiskImage")), Success("/Developer"));
  const auto posted = Received();
  ASSERT_EQ(posted.size(), 4u);
  EXPECT_EQ(posted[0].name, "com.vantrel.mobile.personalized_image_mounted");
  Unmount("/private/var/personalized_debug");
  Unmount("/Developer");
  EXPECT_THAT(LeftBehind(daemon.root()), IsEmpty());
}

TEST_F(DiskImageTest, RefusedImagesLeaveNothingAttachedOrMounted) {
  using TC = ImageRecipe::TrustCache;
  struct Case {
    const char* name;
    ImageRecipe recipe;
    std::string type;
    std::vector<std::string> manifestExtra;  // personalized only
    bool garbleSignature;
    std::string line;
  };
  const Case cases[] = {
      {"version mismatch", {.version = "21.5"}, "Developer", {}, false,
       "default: System Version Mismatch for /Developer: (System: 21.4 / Image: 21.5)"},
      {"trust cache a directory", {.trustCache = TC::Directory}, "Developer", {}, false,
       "default: Failed to load trust caches at /Developer."},
      {"trust cache empty", {.trustCache = TC::Empty}, "Developer", {}, false,
       "default: Failed to load trust caches at /Developer."},
      {"trust cache malformed", {.trustCache = TC::Malformed}, "Developer", {}, false,
       "default: Failed to load trust caches at /Developer."},
      {"not a file system", {.fileSystem = false}, "Developer", {}, false,
       "default: Failed to mount /private/var/run/staging/5.img at /Developer."},
      {"bad signature", {}, "Developer", {}, true, "default: Failed to verify the disk image signature."},
      {"another device", {}, "Personalized", {"--ecid", "0x1122334455667789"}, false,
       "default: Failed to validate server ticket with this device/image"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    const std::string image = BuildImage(c.recipe);
    std::string signature = c.type == "Developer" ? Sign(image) : Manifest(image, "DebugDiskImage", c.manifestExtra);
    if (c.garbleSignature) WriteFile(signature, std::string(256, '\x42'));
    std::string inside;
    EXPECT_EQ(Mount(c.type, image, signature, &inside), kFailure);
    EXPECT_TRUE(daemon.WaitForLogLine(c.line)) << c.line;
    EXPECT_FALSE(fs::exists(daemon.Path(inside)));
    EXPECT_THAT(LeftBehind(daemon.root()), IsEmpty());
    EXPECT_THAT(Received(), IsEmpty());
  }
  // The "/Developer" directory belongs to the system and survives every undo.
  EXPECT_TRUE(fs::is_directory(daemon.Path("/Developer")));
}

TEST_F(DiskImageTest, ImageOpenForWritingOrLinkedElsewhereIsRefused) {
  const std::string image = BuildImage();
  const std::string signature = Sign(image);
  const std::string inside = "/private/var/run/staging/held.img";
  fs::create_directories(daemon.Path("/private/var/run/staging"));

  // A writer holding the staged file open could rewrite it after the digest.
  fs::copy_file(image, daemon.Path(inside));
  {
    const UniqueFd writer(::open(daemon.Path(inside).c_str(), O_WRONLY));
    std::ifstream file(signature, std::ios::binary);
    const plist::Bytes bytes((std::istreambuf_iterator<char>(file)), std::istreambuf_iterator<char>());
    std::optional<plist::Value> reply;
    ASSERT_TRUE(daemon.SendRequest(plist::Dictionary{{"RequestType", "Mount"}, {"DeviceType", "DiskImage"},
                                                     {"DiskImageType", "Developer"}, {"ImageSignature", plist::Value(bytes)},
                                                     {"DiskImagePath", plist::Value(inside)}},
                                   &reply).ok());
    EXPECT_EQ(*reply, kFailure);
  }
  EXPECT_TRUE(daemon.LogContains("default: Failed to take a read lease on " + inside + ": 11"));

  // A second name would let the file be reopened for writing after it is consumed.
  fs::copy_file(image, daemon.Path(inside));
  fs::create_hard_link(daemon.Path(inside), daemon.Path(inside + ".other"));
  std::ifstream file(signature, std::ios::binary);
  const plist::Bytes bytes((std::istreambuf_iterator<char>(file)), std::istreambuf_iterator<char>());
  std::optional<plist::Value> reply;
  ASSERT_TRUE(daemon.SendRequest(plist::Dictionary{{"RequestType", "Mount"}, {"DeviceType", "DiskImage"},
                                                   {"DiskImageType", "Developer"}, {"ImageSignature", plist::Value(bytes)},
                                                   {"DiskImagePath", plist::Value(inside)}},
                                 &reply).ok());
  EXPECT_EQ(*reply, kFailure);
  EXPECT_TRUE(daemon.LogContains("default: " + inside + " has 2 links; only a file with one link is mounted."));
  EXPECT_THAT(LeftBehind(daemon.root()), IsEmpty());
}

}  // namespace
}  // namespace brisvale::testing
