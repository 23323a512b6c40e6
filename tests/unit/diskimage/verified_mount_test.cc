// The verified mount pipeline and the mount request over fakes: which step ends an
// attempt, its exact line, what is undone, and that the staged file is always consumed.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "base/log.h"
#include "daemon/request_handlers.h"
#include "diskimage/attach.h"
#include "diskimage/verified_mount.h"
#include "file_tree_os.h"
#include "platform/services.h"
#include "qor4_test_support.h"
#include "registry/registry_model.h"

namespace brisvale {
namespace {

using ::testing::ElementsAre;
using ::testing::ElementsAreArray;
using ::testing::IsEmpty;
using testing::kDirectory;
using testing::kFile;
using testing::kLink;

constexpr const char* kImage = "/private/var/stage/image.img";
// SHA-1 of the fake image contents "image", as the staging directories spell it.
constexpr const char* kDigestHead = "0E76292794";
constexpr const char* kDigestTail = "888D4F1FA75FB3AFF4CA27C58F56A6";

derwriter::Bytes ManifestWithDigestLength(size_t length) {
  using namespace derwriter;
  return testing_support::DefaultManifest(
      ManifestBody(testing_support::DefaultManifestProperties(),
                   {{"pdmg", {DataProperty("DGST", Bytes(length, 1)), DataProperty("pdnm", Bytes{'D'})}}}));
}

plist::Dictionary Medium(const char* bsdName) {
  return {{"BSD Name", bsdName}, {"Content", ""}, {"Removable", plist::Value::Bool(false)},
          {"Leaf", plist::Value::Bool(true)}};
}

class VerifiedMountTest : public ::testing::Test {
 public:
  VerifiedMountTest() : services_(Services{&registry, &os, nullptr, nullptr}) {
    for (const char* dir : {"/", "/private", "/private/var", "/private/var/stage", "/Developer",
                            "/private/var/personalized_debug"}) {
      os.AddFile(dir, kDirectory);
    }
    os.AddFile(kImage, kFile);
    os.mounts = {{0, "ext4", "/", "/dev/sda1"}};
    registry.Publish(nullptr, "KxMedia", Medium("sda1"));
    steps.checkSignature = [this](const VerifiedMountRequest&, std::span<const uint8_t>) {
      return signatureResult;
    };
    steps.attachAndMount = [this](std::string_view, std::string_view, const VerifiedFile& file) {
      os.calls.push_back("attach");
      attachedFd = file.fd;
      return attachResult;
    };
    steps.loadTrustCache = [this](std::string_view) {
      os.calls.push_back("trust-cache");
      return trustCacheResult;
    };
  }

  VerifiedMountResult Mount(std::string_view type = "Developer", std::string_view mountPath = "/Developer",
                            std::span<const uint8_t> signature = {}) {
    MatchingContext context;
    return MountVerifiedImage(context, {kImage, type, signature, "/cert.pem", mountPath}, steps);
  }

  // A mounted factory image whose staged path carries the fake image's digest.
  void MountIdenticalFactoryImage() {
    const std::string backing = std::string("/private/var/stage/") + kDigestHead + "/" + kDigestTail + "/x.img";
    auto drive = registry.Publish(nullptr, "KxNimbrelHDDriveInKernel",
                                  {{"image-path", plist::Value(plist::Bytes(backing.begin(), backing.end()))}});
    registry.Publish(drive, "KxMedia", Medium("loop4"));
    os.mounts = {{os::kMountReadOnly, "ext4", "/private/var/factory_mount/abc", "/dev/loop4"}};
  }

  std::vector<std::string> DefaultLines() const {
    std::vector<std::string> lines;
    for (const log::Line& line : capture.Lines()) {
      if (line.level == log::Level::Default) lines.push_back(line.text);
    }
    return lines;
  }

  testing::FileTreeOs os;
  registry::RegistryModel registry;
  log::CaptureSink capture;
  MountSteps steps;
  int signatureResult = 0, trustCacheResult = 0, attachedFd = -1;
  std::optional<std::string> attachResult = "/dev/loop7";

 private:
  ScopedServices services_;
};

TEST_F(VerifiedMountTest, EachStepEndsTheAttemptWithItsLineAndConsumesTheImage) {
  const std::string unlink = std::string("unlink ") + kImage;
  const std::string open = std::string("open-image ") + kImage;
  struct Case {
    const char* name;
    std::function<void(VerifiedMountTest&)> arrange;
    std::vector<std::string> lines;
    std::vector<std::string> calls;
  };
  const std::vector<Case> cases = {
      {"missing", [](auto& t) { t.os.files.erase(kImage); },
       {"Failed to lstat /private/var/stage/image.img: 2", "Failed to unlink /private/var/stage/image.img: 2"},
       {unlink}},
      {"a link", [](auto& t) { t.os.AddFile(kImage, kLink); },
       {"/private/var/stage/image.img is not a regular file (mode: 0xa000)."}, {unlink}},
      {"a FIFO", [](auto& t) { t.os.AddFile(kImage, 0010644); },
       {"/private/var/stage/image.img is not a regular file (mode: 0x1000)."}, {unlink}},
      {"swapped before the open", [](auto& t) { t.os.openedStatus = os::FileStatus{kFile, 7, 99, 1}; },
       {"/private/var/stage/image.img was replaced while it was opened."}, {open, unlink}},
      {"a second link", [](auto& t) { t.os.openedStatus = os::FileStatus{kFile, 7, 1, 2}; },
       {"/private/var/stage/image.img has 2 links; only a file with one link is mounted."}, {open, unlink}},
      {"open for writing elsewhere", [](auto& t) { t.os.leaseResult = -EAGAIN; },
       {"Failed to take a read lease on /private/var/stage/image.img: 11"}, {open, unlink}},
      {"bad signature", [](auto& t) { t.signatureResult = -1; },
       {"Failed to verify the disk image signature."}, {open, unlink}},
      {"mount point not empty", [](auto& t) { t.os.AddFile("/Developer/stray", kFile); },
       {"/Developer is not empty.", "Failed to verify the disk image mount path /Developer."}, {open, unlink}},
      {"attach fails", [](auto& t) { t.attachResult.reset(); },
       {"Failed to mount /private/var/stage/image.img at /Developer."}, {open, "attach", unlink}},
      {"trust cache refused", [](auto& t) { t.trustCacheResult = -1; },
       {"Failed to load trust caches at /Developer."},
       {open, "attach", "trust-cache", "force-unmount /Developer", "open /dev/loop7", "eject", unlink}},
      {"mounted", [](auto&) {}, {"Successfully mounted /Developer"}, {open, "attach", "trust-cache", unlink}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    os.files.erase("/Developer/stray");
    os.AddFile(kImage, kFile);
    os.openedStatus.reset();
    os.leaseResult = 0;
    os.calls.clear();
    signatureResult = trustCacheResult = 0;
    attachResult = "/dev/loop7";
    capture.Clear();
    c.arrange(*this);
    const VerifiedMountResult result = Mount();
    EXPECT_EQ(DefaultLines(), c.lines);
    EXPECT_EQ(os.calls, c.calls);
    EXPECT_EQ(result.deviceNode.has_value(), std::string(c.name) == "mounted");
  }
}

TEST_F(VerifiedMountTest, TrustCacheUndoRemovesTheDirectoryOutsideDeveloper) {
  trustCacheResult = -1;
  EXPECT_FALSE(Mount("Personalized", "/private/var/personalized_debug", ManifestWithDigestLength(48)).deviceNode);
  EXPECT_THAT(os.calls, ElementsAre(std::string("open-image ") + kImage, "attach", "trust-cache",
                                    "force-unmount /private/var/personalized_debug",
                                    "rmdir /private/var/personalized_debug", "open /dev/loop7", "eject",
                                    std::string("unlink ") + kImage));
}

TEST_F(VerifiedMountTest, DigestComesFromTheVerifiedDescriptorAndFindsAnIdenticalImage) {
  MountIdenticalFactoryImage();
  const VerifiedMountResult result = Mount("Factory", "/private/var/factory_mount/new");
  EXPECT_FALSE(result.deviceNode);
  EXPECT_EQ(result.existingMountPath, "/private/var/factory_mount/abc");
  EXPECT_THAT(DefaultLines(), ElementsAre("Matching image of type Factory/(null) found."));
  EXPECT_THAT(os.calls, ElementsAre(std::string("open-image ") + kImage, std::string("unlink ") + kImage));

  // A digest length the manifest cannot ask for stops before anything is looked up.
  const derwriter::Bytes manifest = ManifestWithDigestLength(32);
  os.AddFile(kImage, kFile);
  capture.Clear();
  EXPECT_FALSE(Mount("Personalized", "/private/var/personalized_debug", manifest).imageDigest);
  EXPECT_THAT(DefaultLines(), ElementsAre("Unsupported digest size: 32", "Failed to digest data.",
                                          "Failed to digest /private/var/stage/image.img."));
}

TEST_F(VerifiedMountTest, AttachStopsWhenTheLeaseWasBroken) {
  // A controller that attaches whatever it is asked to and publishes its media at once.
  auto controller = registry.Publish(nullptr, "KxNimbrelController", {});
  std::vector<plist::Dictionary> requests;
  class Client : public registry::UserClient {
   public:
    Client(registry::RegistryModel& registry, std::vector<plist::Dictionary>& requests)
        : registry_(registry), requests_(requests) {}
    registry::Status CallMethod(uint32_t, registry::MethodArgs& args) override {
      uint64_t address = 0, length = 0;
      std::memcpy(&address, args.structIn.data() + 8, 8);
      std::memcpy(&length, args.structIn.data() + 16, 8);
      auto value = plist::ReadXml({reinterpret_cast<const uint8_t*>(address), length});
      requests_.push_back(*value->dictionary());
      auto drive = registry_.Publish(nullptr, "KxNimbrelHDDriveInKernel",
                                     {{"nimbrel-unique-identifier", *value->get("nimbrel-unique-identifier")}});
      registry_.Publish(drive, "KxMedia", {{"BSD Name", "loop" + std::to_string(requests_.size())}});
      return registry::kSuccess;
    }

   private:
    registry::RegistryModel& registry_;
    std::vector<plist::Dictionary>& requests_;
  };
  registry.SetUserClientFactory(controller, [&](uint32_t) {
    return registry::Result<std::unique_ptr<registry::UserClient>>{
        registry::kSuccess, std::make_unique<Client>(registry, requests)};
  });

  const VerifiedFile file{3, 7, 42};
  const auto first = AttachDiskImage(kImage, &file);
  const auto second = AttachDiskImage(kImage, &file);
  ASSERT_TRUE(first && second);
  EXPECT_NE(*first, *second);
  EXPECT_EQ(FindAttachedMedia(*second), "loop2");
  ASSERT_EQ(requests.size(), 2u);
  EXPECT_EQ(*requests[0].find("image-inode"), plist::Value::UInt(42));
  EXPECT_EQ(*requests[0].find("image-device"), plist::Value::UInt(7));

  os.leaseHeld = false;
  os.calls.clear();
  capture.Clear();
  EXPECT_FALSE(AttachAndMountImage(kImage, "/Developer", &file));
  EXPECT_THAT(DefaultLines(),
              ElementsAre("/private/var/stage/image.img was opened for writing after it was verified."));
  EXPECT_THAT(os.calls, ElementsAre("open /dev/loop3", "eject"));
}

TEST_F(VerifiedMountTest, MountRequestRefusesBadKeysAndASecondImageAtTheSamePlace) {
  MountIdenticalFactoryImage();
  os.mounts.push_back({os::kMountReadOnly, "ext4", "/Developer", "/dev/loop4"});
  const plist::Bytes signature{1, 2, 3};
  const struct {
    plist::Dictionary request;
    std::string line;
  } cases[] = {
      {{{"DeviceType", "Camera"}}, "Unsupported device type: Camera"},
      {{{"DeviceType", plist::Value::Int(1)}}, "Invalid value for DeviceType: 1"},
      {{{"DeviceType", "DiskImage"}, {"DiskImageType", "Developer"}, {"ImageSignature", "text"}},
       "Invalid value for ImageSignature: text"},
      {{{"DeviceType", "DiskImage"}, {"DiskImageType", "Developer"}, {"ImageSignature", signature}},
       "Invalid value for DiskImagePath: (null)"},
      {{{"DeviceType", "DiskImage"}, {"DiskImageType", "developer"}, {"ImageSignature", signature},
        {"DiskImagePath", kImage}},
       "Unsupported disk image type: developer"},
      {{{"DeviceType", "DiskImage"}, {"DiskImageType", "Developer"}, {"ImageSignature", signature},
        {"DiskImagePath", kImage}},
       "A disk image of type Developer/(null) is already mounted at /Developer."},
  };
  MatchingContext context;
  for (const auto& c : cases) {
    SCOPED_TRACE(c.line);
    capture.Clear();
    plist::Dictionary reply{{"Status", "Failure"}};
    HandleMountRequest(context, plist::Value(c.request), reply);
    EXPECT_EQ(reply, (plist::Dictionary{{"Status", "Failure"}}));
    EXPECT_THAT(DefaultLines(), ElementsAre(c.line));
  }
  // Refused requests never consume the staged file.
  EXPECT_TRUE(os.files.contains(kImage));
}

}  // namespace
}  // namespace brisvale
