// Mount locations by type and sub-type, the mount-directory check and the path check,
// over a file table.
#include <gtest/gtest.h>

#include "diskimage/mount_locations.h"
#include "disk_image_fixture.h"

namespace brisvale {
namespace {

using testing::kDirectory;
using testing::kFile;
using MountLocationsTest = testing::DiskImageTest;

TEST_F(MountLocationsTest, TypeAndSubTypeDecideDirectoryAndNotification) {
  os.mkdirErrors["/private/var/personalized_demo"] = -EACCES;
  const std::string personalized = "com.vantrel.mobile.personalized_image_mounted";
  const struct {
    std::string type, subType;  // subType "": no manifest; "-": garbage
    std::string mountPath;      // "": refused with `line`
    std::string notificationOrLine;
  } cases[] = {
      {"Developer", "", "/Developer", "com.vantrel.mobile.developer_image_mounted"},
      {"Factory", "", "/private/var/factory_mount/1000001", "com.vantrel.mobile.factory_image_mounted"},
      {"Personalized", "DeveloperDiskImage", "/Developer", personalized},
      {"Personalized", "DebugDiskImage", "/private/var/personalized_debug", personalized},
      {"Personalized", "FactoryDiskImage", "/private/var/personalized_factory/1000002", personalized},
      {"developer", "", "", "Unsupported disk image type: developer"},
      {"Personalized", "DeveloperDiskImageX", "", "Invalid personalized disk image type: DeveloperDiskImageX"},
      {"Personalized", "DemoDiskImage", "", "Failed to create mount path /private/var/personalized_demo: 13"},
      {"Personalized", "-", "", "Failed to decode qor4 manifest: 3"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.type + "/" + c.subType);
    capture.Clear();
    const derwriter::Bytes manifest = c.subType == "-"  ? derwriter::Bytes{0x30, 0x03, 1}
                                      : c.subType.empty() ? derwriter::Bytes{}
                                                          : testing::ManifestOf(c.subType);
    const std::optional<MountLocation> location = ResolveMountLocation(c.type, manifest);
    if (c.mountPath.empty()) {
      EXPECT_FALSE(location);
      EXPECT_EQ(capture.Texts(log::Level::Default), std::vector{c.notificationOrLine});
      continue;
    }
    ASSERT_TRUE(location);
    EXPECT_EQ(location->mountPath, c.mountPath);
    EXPECT_EQ(location->typeNotification, c.notificationOrLine);
    EXPECT_EQ(location->certificatePath.has_value(), c.type != "Personalized");
  }
  // Fresh directories are opened up to 0755 (mkdtemp makes them 0700).
  EXPECT_EQ(std::count(os.calls.begin(), os.calls.end(), "chmod /private/var/factory_mount/1000001 493"), 1);
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
      {"/private/var/debug_mount2", -1, {"Failed to lstat /private/var/debug_mount2: 2"}},
      {"/private/var/debug_mountX", -1, {"/private/var/debug_mountX is not a directory."}},
      {"/private/var/full", -1, {"/private/var/full is not empty."}},
      {std::string(1025, 'a'), -1, {"Failed to create string."}},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.path.substr(0, 40));
    capture.Clear();
    EXPECT_EQ(ValidateMountPoint(c.path), c.result);
    EXPECT_EQ(capture.Texts(log::Level::Default), c.lines);
  }
  // Every entry of a full directory is named, not just the first.
  capture.Clear();
  ValidateMountPoint("/private/var/full");
  EXPECT_TRUE(capture.Contains(log::Level::Info, "Mount path /private/var/full is not empty: /private/var/full/.hidden"));
  EXPECT_TRUE(capture.Contains(log::Level::Info, "Mount path /private/var/full is not empty: /private/var/full/sub"));
  // A missing /Developer is not made: it belongs to the system image.
  os.files.erase("/Developer");
  EXPECT_EQ(ValidateMountPoint("/Developer"), -1);
}

TEST_F(MountLocationsTest, OnlyCanonicalLinkFreeExistingPathsAreSafe) {
  for (const char* dir : {"/", "/private", "/private/var", "/private/var/tmp"}) os.AddFile(dir, kDirectory);
  os.AddFile("/private/var/tmp/image.img", kFile);
  os.AddFile("/var", testing::kLink);
  os.AddFile("/private/var/tmp/../tmp/image.img", kFile);
  os.realPaths["/var/tmp/image.img"] = os.realPaths["/private/var/tmp/../tmp/image.img"] = "/private/var/tmp/image.img";
  const std::string tooLong = "/" + std::string(1024, 'a');
  os.AddFile(tooLong, kFile);
  const struct {
    std::string path;
    std::string line;  // "" when safe
  } cases[] = {
      {"/private/var/tmp/image.img", ""},
      {"/var/tmp/image.img", "Paths don't match: (/var/tmp/image.img/)"},
      {"/private/var/tmp/../tmp/image.img",
       "Paths don't match: (/private/var/tmp/../tmp/image.img//private/var/tmp/image.img)"},
      {tooLong, "Paths don't match: (" + tooLong + "/)"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.path.substr(0, 40));
    capture.Clear();
    EXPECT_EQ(IsUnsafePath(c.path), !c.line.empty());
    EXPECT_EQ(capture.Texts(log::Level::Default), c.line.empty() ? std::vector<std::string>{} : std::vector{c.line});
  }
}

}  // namespace
}  // namespace brisvale
