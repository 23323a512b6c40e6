// The verified mount pipeline over fakes: which step ends an attempt, its exact line,
// what is undone, and that the staged file is always consumed.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "diskimage/verified_mount.h"
#include "disk_image_fixture.h"

namespace brisvale {
namespace {

using ::testing::ElementsAre;
using testing::kFile;
using testing::Medium;

constexpr const char* kImage = "/private/var/stage/image.img";

struct VerifiedMountTest : testing::DiskImageTest {
  VerifiedMountTest() {
    for (const char* dir : {"/", "/private", "/private/var", "/private/var/stage", "/Developer",
                            "/private/var/personalized_debug"}) {
      os.AddFile(dir, testing::kDirectory);
    }
    os.mounts = {{0, "ext4", "/", "/dev/sda1"}};
    registry.Publish(nullptr, "KxMedia", Medium("sda1", false, true, ""));
    steps.checkSignature = [this](const VerifiedMountRequest&, std::span<const uint8_t>) { return signatureResult; };
    steps.attachAndMount = [this](std::string_view, std::string_view, const VerifiedFile&) {
      os.calls.push_back("attach");
      return attachResult;
    };
    steps.loadTrustCache = [this](std::string_view) { return trustCacheResult; };
  }

  VerifiedMountResult Mount(std::string_view type, std::string_view mountPath, std::span<const uint8_t> signature = {}) {
    MatchingContext context;
    return MountVerifiedImage(context, {kImage, type, signature, "/cert.pem", mountPath}, steps);
  }

  MountSteps steps;
  int signatureResult = 0, trustCacheResult = 0;
  std::optional<std::string> attachResult = "/dev/loop7";
};

TEST_F(VerifiedMountTest, EachStepEndsTheAttemptWithItsLineUndoesWhatItMadeAndConsumesTheImage) {
  const std::string unlink = std::string("unlink ") + kImage, open = std::string("open-image ") + kImage;
  const derwriter::Bytes manifest = testing::ManifestOf("DebugDiskImage");
  struct Case {
    const char* name;
    std::function<void(VerifiedMountTest&)> arrange;
    std::vector<std::string> lines, calls;
    std::string mountPath = "/Developer";
    const char* type = "Developer";
  };
  const std::vector<Case> cases = {
      {"missing", [](auto& t) { t.os.files.erase(kImage); },
       {"Failed to lstat /private/var/stage/image.img: 2", "Failed to unlink /private/var/stage/image.img: 2"}, {unlink}},
      {"a link", [](auto& t) { t.os.AddFile(kImage, testing::kLink); },
       {"/private/var/stage/image.img is not a regular file (mode: 0xa000)."}, {unlink}},
      {"swapped before the open", [](auto& t) { t.os.openedStatus = os::FileStatus{kFile, 7, 99, 1}; },
       {"/private/var/stage/image.img was replaced while it was opened."}, {open, unlink}},
      {"a second link", [](auto& t) { t.os.openedStatus = os::FileStatus{kFile, 7, 1, 2}; },
       {"/private/var/stage/image.img has 2 links; only a file with one link is mounted."}, {open, unlink}},
      {"open for writing elsewhere", [](auto& t) { t.os.leaseResult = -EAGAIN; },
       {"Failed to take a read lease on /private/var/stage/image.img: 11"}, {open, unlink}},
      {"bad signature", [](auto& t) { t.signatureResult = -1; },
       {"Failed to verify the disk image signature."}, {open, unlink}},
      {"ticket refused", [](auto& t) { t.signatureResult = -1; },
       {"Failed to validate server ticket with this device/image"}, {open, unlink},
       "/private/var/personalized_debug", "Personalized"},
      {"mount point not empty", [](auto& t) { t.os.AddFile("/Developer/stray", kFile); },
       {"/Developer is not empty.", "Failed to verify the disk image mount path /Developer."}, {open, unlink}},
      {"attach fails", [](auto& t) { t.attachResult.reset(); },
       {"Failed to mount /private/var/stage/image.img at /Developer."}, {open, "attach", unlink}},
      {"trust cache refused", [](auto& t) { t.trustCacheResult = -1; },
       {"Failed to load trust caches at /Developer."},
       {open, "attach", "force-unmount /Developer", "open /dev/loop7", "eject", unlink}},
      {"trust cache refused outside /Developer", [](auto& t) { t.trustCacheResult = -1; },
       {"Failed to load trust caches at /private/var/personalized_debug."},
       {open, "attach", "force-unmount /private/var/personalized_debug", "rmdir /private/var/personalized_debug",
        "open /dev/loop7", "eject", unlink},
       "/private/var/personalized_debug"},
      {"mounted", [](auto&) {}, {"Successfully mounted /Developer"}, {open, "attach", unlink}},
  };
  os.AddFile(kImage, kFile);
  const testing::FileTreeOs staged = os;
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    os = staged;
    signatureResult = trustCacheResult = 0;
    attachResult = "/dev/loop7";
    capture.Clear();
    c.arrange(*this);
    EXPECT_EQ(Mount(c.type, c.mountPath, manifest).deviceNode.has_value(), std::string(c.name) == "mounted");
    EXPECT_EQ(capture.Texts(log::Level::Default), c.lines);
    EXPECT_EQ(os.calls, c.calls);
  }
}

TEST_F(VerifiedMountTest, DigestComesFromTheVerifiedDescriptorAndFindsAnIdenticalImage) {
  // A mounted image staged below directories spelling the SHA-1 of "image".
  const std::string backing = "/stage/0E76292794/888D4F1FA75FB3AFF4CA27C58F56A6/x.img";
  const auto drive = registry.Publish(nullptr, "KxNimbrelHDDriveInKernel",
                                      {{"image-path", plist::Value(plist::Bytes(backing.begin(), backing.end()))}});
  registry.Publish(drive, "KxMedia", Medium("loop4", false, true, ""));
  os.mounts.push_back({os::kMountReadOnly, "ext4", "/private/var/factory_mount/abc", "/dev/loop4"});
  os.AddFile(kImage, kFile);
  const VerifiedMountResult result = Mount("Factory", "/private/var/factory_mount/new");
  EXPECT_FALSE(result.deviceNode);
  EXPECT_EQ(result.existingMountPath, "/private/var/factory_mount/abc");
  EXPECT_THAT(capture.Texts(log::Level::Default), ElementsAre("Matching image of type Factory/(null) found."));
  EXPECT_THAT(os.calls, ElementsAre(std::string("open-image ") + kImage, std::string("unlink ") + kImage));

  // A digest length the manifest cannot ask for stops before anything is looked up.
  os.AddFile(kImage, kFile);
  capture.Clear();
  EXPECT_FALSE(Mount("Personalized", "/private/var/personalized_debug", testing::ManifestOf("DebugDiskImage", 32)).imageDigest);
  EXPECT_THAT(capture.Texts(log::Level::Default), ElementsAre("Unsupported digest size: 32", "Failed to digest data.",
                                          "Failed to digest /private/var/stage/image.img."));
}

}  // namespace
}  // namespace brisvale
