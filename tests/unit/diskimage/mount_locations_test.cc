// Mount locations by type and sub-type, the mount-directory check and the path check,
// over a file table.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "base/log.h"
#include "diskimage/mount_locations.h"
#include "file_tree_os.h"
#include "platform/services.h"
#include "qor4_test_support.h"

namespace brisvale {
namespace {

using ::testing::ElementsAre;
using ::testing::ElementsAreArray;
using testing::kDirectory;
using testing::kFile;
using testing::kLink;

derwriter::Bytes ManifestOfSubType(std::string_view subType) {
  using namespace derwriter;
  return testing_support::DefaultManifest(ManifestBody(
      testing_support::DefaultManifestProperties(),
      {{"pdmg", {DataProperty("DGST", Bytes(48, 1)), DataProperty("pdnm", Bytes(subType.begin(), subType.end()))}}}));
}

class MountLocationsTest : public ::testing::Test {
 protected:
  MountLocationsTest() : services_(Services{nullptr, &os, nullptr, nullptr}) {}

  std::vector<std::string> DefaultLines() const {
    std::vector<std::string> lines;
    for (const log::Line& line : capture.Lines()) {
      if (line.level == log::Level::Default) lines.push_back(line.text);
    }
    return lines;
  }

  testing::FileTreeOs os;
  log::CaptureSink capture;

 private:
  ScopedServices services_;
};

TEST_F(MountLocationsTest, EachTypeAndSubTypeHasItsDirectoryAndNotification) {
  struct Case {
    std::string type;
    std::string subType;  // empty: no manifest
    std::string mountPath;
    std::string notification;
    bool certificate;
  };
  const std::string personalized = "com.vantrel.mobile.personalized_image_mounted";
  const Case cases[] = {
      {"Developer", "", "/Developer", "com.vantrel.mobile.developer_image_mounted", true},
      {"Factory", "", "/private/var/factory_mount/1000001", "com.vantrel.mobile.factory_image_mounted", true},
      {"Personalized", "DeveloperDiskImage", "/Developer", personalized, false},
      {"Personalized", "DebugDiskImage", "/private/var/personalized_debug", personalized, false},
      {"Personalized", "DemoDiskImage", "/private/var/personalized_demo", personalized, false},
      {"Personalized", "FactoryDiskImage", "/private/var/personalized_factory/1000001", personalized, false},
      {"Personalized", "AutomationDiskImage", "/private/var/personalized_automation", personalized, false},
      {"Personalized", "ProdAutomationDiskImage", "/private/var/personalized_automation", personalized, false},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.type + "/" + c.subType);
    os.temporaryCount = 0;
    const derwriter::Bytes manifest = c.subType.empty() ? derwriter::Bytes{} : ManifestOfSubType(c.subType);
    const std::optional<MountLocation> location = ResolveMountLocation(c.type, manifest);
    ASSERT_TRUE(location);
    EXPECT_EQ(location->mountPath, c.mountPath);
    EXPECT_EQ(location->typeNotification, c.notification);
    EXPECT_EQ(location->certificatePath.has_value(), c.certificate);
    EXPECT_EQ(location->subType.value_or(""), c.subType);
  }
  EXPECT_THAT(DefaultLines(), ::testing::IsEmpty());
}

TEST_F(MountLocationsTest, FactoryDirectoriesAreFreshAndReachable) {
  const auto first = ResolveMountLocation("Factory", {});
  const auto second = ResolveMountLocation("Factory", {});
  ASSERT_TRUE(first && second);
  EXPECT_NE(first->mountPath, second->mountPath);
  EXPECT_THAT(os.calls, ElementsAre("mkdir /private/var/factory_mount", "mkdir " + first->mountPath,
                                    "chmod " + first->mountPath + " 755", "mkdir /private/var/factory_mount",
                                    "mkdir " + second->mountPath, "chmod " + second->mountPath + " 755"));
}

TEST_F(MountLocationsTest, RefusedTypesLogTheirLine) {
  os.mkdirErrors["/private/var/factory_mount"] = -EROFS;
  os.mkdirErrors["/private/var/personalized_demo"] = -EACCES;
  const struct {
    std::string type;
    derwriter::Bytes signature;
    std::vector<std::string> lines;
  } cases[] = {
      {"developer", {}, {"Unsupported disk image type: developer"}},
      {"Factory", {}, {"Failed to create /private/var/factory_mount: 30"}},
      {"Personalized", ManifestOfSubType("DeveloperDiskImageX"),
       {"Invalid personalized disk image type: DeveloperDiskImageX"}},
      {"Personalized", ManifestOfSubType("developerdiskimage"),
       {"Invalid personalized disk image type: developerdiskimage"}},
      {"Personalized", ManifestOfSubType("DemoDiskImage"),
       {"Failed to create mount path /private/var/personalized_demo: 13"}},
      {"Personalized", {0x30, 0x03, 1}, {"Failed to decode qor4 manifest: 3"}},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.type);
    capture.Clear();
    EXPECT_FALSE(ResolveMountLocation(c.type, c.signature));
    EXPECT_EQ(DefaultLines(), c.lines);
  }
}

TEST_F(MountLocationsTest, MountPointMustBeAnEmptyDirectoryOrACreatableRoot) {
  os.AddFile("/Developer", kDirectory);
  os.AddFile("/private/var/debug_mountX", kFile);
  os.AddFile("/private/var/full", kDirectory);
  os.AddFile("/private/var/full/.hidden", kFile);
  os.AddFile("/private/var/full/sub", kDirectory);
  const struct {
    std::string path;
    int result;
    std::vector<std::string> lines;
  } cases[] = {
      {"/Developer", 0, {}},
      {"/private/var/personalized_demo", 0, {}},
      {"/private/var/debug_mount", 0, {}},
      {"/private/var/personalized_debug/nested", 0, {}},
      {"/private/var/debug_mount2", -1, {"Failed to lstat /private/var/debug_mount2: 2"}},
      {"/private/var/debug_mountX", -1, {"/private/var/debug_mountX is not a directory."}},
      {"/private/var/full", -1, {"/private/var/full is not empty."}},
      {std::string(1025, 'a'), -1, {"Failed to create string."}},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.path.substr(0, 40));
    capture.Clear();
    EXPECT_EQ(ValidateMountPoint(c.path), c.result);
    EXPECT_EQ(DefaultLines(), c.lines);
  }
  // Every entry of a full directory is named, not just the first.
  capture.Clear();
  EXPECT_EQ(ValidateMountPoint("/private/var/full"), -1);
  EXPECT_TRUE(capture.Contains(log::Level::Info, "Mount path /private/var/full is not empty: /private/var/full/.hidden"));
  EXPECT_TRUE(capture.Contains(log::Level::Info, "Mount path /private/var/full is not empty: /private/var/full/sub"));

  // A missing /Developer is not made: it belongs to the system image.
  os.files.erase("/Developer");
  capture.Clear();
  EXPECT_EQ(ValidateMountPoint("/Developer"), -1);
  EXPECT_THAT(DefaultLines(), ElementsAre("Failed to lstat /Developer: 2"));
}

TEST_F(MountLocationsTest, OnlyCanonicalLinkFreeExistingPathsAreSafe) {
  os.AddFile("/", kDirectory);
  os.AddFile("/private", kDirectory);
  os.AddFile("/private/var", kDirectory);
  os.AddFile("/private/var/tmp", kDirectory);
  os.AddFile("/private/var/tmp/image.img", kFile);
  os.AddFile("/var", kLink);
  os.AddFile("/var/tmp/image.img", kFile);
  os.realPaths["/var/tmp/image.img"] = "/private/var/tmp/image.img";
  os.AddFile("/private/var/tmp/../tmp/image.img", kFile);
  os.realPaths["/private/var/tmp/../tmp/image.img"] = "/private/var/tmp/image.img";
  const struct {
    std::string path;
    bool unsafe;
    std::string line;
  } cases[] = {
      {"/private/var/tmp/image.img", false, ""},
      {"/var/tmp/image.img", true, "Paths don't match: (/var/tmp/image.img/)"},
      {"/private/var/tmp/../tmp/image.img", true,
       "Paths don't match: (/private/var/tmp/../tmp/image.img//private/var/tmp/image.img)"},
      {"/private/var/tmp/missing.img", true, "Paths don't match: (/private/var/tmp/missing.img/)"},
      {"image.img", true, "Paths don't match: (image.img/)"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.path);
    capture.Clear();
    EXPECT_EQ(IsUnsafePath(c.path), c.unsafe);
    EXPECT_EQ(DefaultLines(), c.line.empty() ? std::vector<std::string>{} : std::vector{c.line});
  }
  // Too long to be a path: refused before the file system is asked.
  const std::string longPath = "/" + std::string(1024, 'a');
  os.AddFile(longPath, kFile);
  EXPECT_TRUE(IsUnsafePath(longPath));
}

}  // namespace
}  // namespace brisvale
