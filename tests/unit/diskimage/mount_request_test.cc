// The "Mount" request routing and the disk-image request's refusals over the fake system:
// which field or rule stops it, its exact lines, and the reply left as "Failure".
#include "diskimage/mount_request.h"

#include <gtest/gtest.h>

#include "daemon/request_handlers.h"
#include "disk_image_fixture.h"

namespace brisvale {
namespace {

using MountRequestTest = testing::DiskImageTest;

TEST_F(MountRequestTest, EachRefusalLeavesTheFailureReplyAndItsLines) {
  // A Developer image is mounted at /Developer.
  const std::string backing = "/stage/0E76292794/888D4F1FA75FB3AFF4CA27C58F56A6/x.img";
  const auto drive = registry.Publish(nullptr, "KxNimbrelHDDriveInKernel",
                                      {{"image-path", plist::Value(plist::Bytes(backing.begin(), backing.end()))}});
  registry.Publish(drive, "KxMedia", testing::Medium("loop4", false, true, ""));
  os.mounts = {{os::kMountReadOnly, "hfs", "/Developer", "/dev/loop4"}};
  const std::string missing = "/stage/missing.img";
  const struct {
    std::string key;
    std::optional<plist::Value> value;  // none: the key is left out
    std::vector<std::string> lines;
  } cases[] = {
      {"DeviceType", plist::Value("Camera"), {"Unsupported device type: Camera"}},
      {"DeviceType", plist::Value("MassStorage"), {"Invalid value for DeviceNode: (null)"}},
      {"DiskImageType", plist::Value::Int(1), {"Invalid value for DiskImageType: 1"}},
      {"ImageSignature", plist::Value("x"), {"Invalid value for ImageSignature: x"}},
      {"DiskImagePath", std::nullopt, {"Invalid value for DiskImagePath: (null)"}},
      {"DiskImageType", plist::Value("developer"), {"Unsupported disk image type: developer"}},
      {"DiskImageType", plist::Value("Developer"),
       {"A disk image of type Developer/(null) is already mounted at /Developer."}},
      {"DiskImagePath", plist::Value(missing),
       {"Failed to lstat " + missing + ": 2", "Failed to unlink " + missing + ": 2"}},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.lines.front());
    plist::Dictionary request{{"DeviceType", "DiskImage"},
                              {"DiskImageType", "Factory"},
                              {"ImageSignature", plist::Value(plist::Bytes(128, 1))},
                              {"DiskImagePath", plist::Value(missing)}};
    if (c.value) {
      request.set(c.key, *c.value);
    } else {
      request.erase(c.key);
    }
    plist::Dictionary reply{{"Status", "Failure"}};
    capture.Clear();
    MatchingContext context;
    HandleMountRequest(context, plist::Value(request), reply);
    EXPECT_EQ(reply, (plist::Dictionary{{"Status", "Failure"}}));
    EXPECT_EQ(capture.Texts(log::Level::Default), c.lines);
  }
}

}  // namespace
}  // namespace brisvale
