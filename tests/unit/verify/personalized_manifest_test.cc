// The personalized manifest check against the device identity and the image digest.
#include "verify/personalized_manifest.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <limits>
#include <ostream>

#include "base/log.h"
#include "imgtool/options.h"
#include "platform/device_properties.h"
#include "test_support.h"
#include "verify/image_digest.h"

namespace brisvale::verify {
namespace {

using Args = std::vector<std::string>;
using Lines = std::vector<std::string>;

const Args kDevice = {"--nonce", "00112233445566778899aabbccddeeff", "--board", "8",
                      "--chip", "0x8030", "--ecid", "0x1122334455667788",
                      "--production", "true", "--security", "true"};

struct Case {
  const char* name;
  Args manifest;            // beyond the device's own values and the image
  Args identity;            // replaces the device's values when not empty
  const char* hashMethod;   // nullptr: none recorded
  long digestLength;        // how the image is digested before the check
  int result;
  Lines lastLines;          // the final default-level lines
};

void PrintTo(const Case& c, std::ostream* os) { *os << c.name; }

// The device's options, each "--option value" pair of `overrides` replacing or added.
Args Merge(Args merged, const Args& overrides) {
  for (size_t i = 0; i + 1 < overrides.size(); i += 2) {
    auto found = std::find(merged.begin(), merged.end(), overrides[i]);
    if (found != merged.end()) {
      *(found + 1) = overrides[i + 1];
    } else {
      merged.insert(merged.end(), {overrides[i], overrides[i + 1]});
    }
  }
  return merged;
}

class PersonalizedManifestTest : public ::testing::TestWithParam<Case> {
 protected:
  void TearDown() override { device::SetDeviceIdentityPath(""); }
  testing::ScratchDir dir_;
};

TEST_P(PersonalizedManifestTest, ChecksDeviceAndImage) {
  const Case& c = GetParam();
  std::string image = (dir_ / "image").string();
  testing::WriteFileBytes(image, testing::Bytes(70000, 0xA5));

  Args identity = {"identity", "-o", (dir_ / "identity.plist").string()};
  const Args& deviceValues = c.identity.empty() ? kDevice : c.identity;
  identity.insert(identity.end(), deviceValues.begin(), deviceValues.end());
  if (c.hashMethod) identity.insert(identity.end(), {"--hash-method", c.hashMethod});
  ASSERT_TRUE(testing::RunImgtool(identity));
  device::SetDeviceIdentityPath((dir_ / "identity.plist").string());

  Args manifest = {"manifest", "--image", image, "-o", (dir_ / "manifest").string()};
  Args values = Merge(kDevice, c.manifest);
  manifest.insert(manifest.end(), values.begin(), values.end());
  ASSERT_TRUE(testing::RunImgtool(manifest));

  std::vector<uint8_t> digest;
  ASSERT_EQ(DigestImageFile(image, &digest, c.digestLength), 0);
  log::CaptureSink capture;
  EXPECT_EQ(VerifyPersonalizedManifest(testing::ReadFileBytes(dir_ / "manifest"), digest), c.result);
  EXPECT_EQ(capture.Texts(Level::Default), c.lastLines);
}

// The two lines of a manifest tag that does not match the device or the image.
Lines TagRefused(const std::string& tag) {
  return {"Failed to validate manifest tag: " + tag, "Failed to evaluate trust: -1"};
}

const Args kDeviceWithoutNonce(kDevice.begin() + 2, kDevice.end());
const Args kDeviceWithNumbers = [] { Args a = kDevice; a.push_back("--numbers"); return a; }();

const Case kCases[] = {
    {"Sha384Matches", {}, {}, "sha384", 48, 0, {}},
    {"Sha1Matches", {"--chain", "sha1", "--dgst", "sha1"}, {}, "sha1", 20, 0, {}},
    {"ModesAsIntegers", {}, kDeviceWithNumbers, "sha384", 48, 0, {}},
    {"UnknownTagAccepted", {"--property", "XXXX=int:7", "--object-property", "YYYY=str:z"}, {},
     "sha384", 48, 0, {}},
    {"PinnedValueHonoured", {"--leaf-constraint", "CHIP=int:0x8030"}, {}, "sha384", 48, 0, {}},
    {"AnotherDevice", {"--ecid", "0x1122334455667789"}, {}, "sha384", 48, -1, TagRefused("ECID")},
    {"EcidHighBitsCount", {"--ecid", "0x0000000055667788"}, {}, "sha384", 48, -1, TagRefused("ECID")},
    {"OtherBoard", {"--board", "9"}, {}, "sha384", 48, -1, TagRefused("BORD")},
    {"OtherImage", {"--dgst", "hex:" + std::string(96, '0')}, {}, "sha384", 48, -1, TagRefused("DGST")},
    {"DigestLengthDiffers", {"--dgst", "sha1"}, {}, "sha384", 48, -1, TagRefused("DGST")},
    {"EkeyFalse", {"--ekey", "false"}, {}, "sha384", 48, -1, TagRefused("EKEY")},
    {"SdomZero", {"--sdom", "0"}, {}, "sha384", 48, -1, TagRefused("SDOM")},
    {"ProductionDiffers", {"--production", "false"}, {}, "sha384", 48, -1, TagRefused("CPRO")},
    {"DeviceWithoutNonce", {}, kDeviceWithoutNonce, "sha384", 48, -1, TagRefused("BNCH")},
    // The leaf pins another chip: its constraint fails before any tag rule runs.
    {"PinnedValueBroken", {"--leaf-constraint", "CHIP=int:1"}, {}, "sha384", 48, -1,
     {"Failed to evaluate trust: -1"}},
    // A leaf without the constraint extension has nothing to evaluate: a decode error.
    {"LeafWithoutConstraintExtension", {"--leaf", "plain"}, {}, "sha384", 48, -1,
     {"Failed to evaluate trust: 3"}},
    // Any text but "sha1" selects the one-certificate SHA-384 chain.
    {"EmptyHashMethodIsSha384", {"--chain", "sha1", "--dgst", "sha1"}, {}, "", 20, -1,
     {"Failed to evaluate trust: -1"}},
    {"UpperCaseSha1IsSha384", {}, {}, "SHA1", 48, 0, {}},
    {"Sha1MethodRefusesSha384Chain", {}, {}, "sha1", 48, -1, {"Failed to evaluate trust: -1"}},
    {"NoHashMethod", {}, {}, nullptr, 48, -1, {"Failed to retrieve Qor4CryptoHashMethod."}},
    {"NoDiskImageObject", {"--object", "pdmX"}, {}, "sha384", 48, -1, {"Failed to evaluate trust: 1"}},
};

INSTANTIATE_TEST_SUITE_P(Manifests, PersonalizedManifestTest, ::testing::ValuesIn(kCases),
                         [](const auto& info) { return std::string(info.param.name); });

TEST(VerifyPersonalizedManifest, UndecodableManifestFailsFirst) {
  std::vector<uint8_t> digest(48);
  struct {
    testing::Bytes bytes;
    const char* line;
  } cases[] = {
      {{}, "Failed to initialize qor4 manifest: 6"},
      {{0x31, 0x00}, "Failed to initialize qor4 manifest: 2"},
  };
  for (const auto& c : cases) {
    log::CaptureSink capture;
    EXPECT_EQ(VerifyPersonalizedManifest(c.bytes, digest), -1);
    EXPECT_EQ(capture.Texts(), Lines{c.line});
  }
}

TEST(EvaluateManifestProperty, UnhandledTagIsOnlyADebugNote) {
  testing::Bytes property = imgtool::ParseHex("300916045858585802012a", "property");  // SEQ { "XXXX", 42 }
  device::DeviceIdentity identity;
  ManifestCheckContext check{{}, &identity};
  log::CaptureSink capture;
  Qor4PropertyRef ref{{property.data(), static_cast<uint32_t>(property.size())}, DERTagInteger};
  EXPECT_EQ(EvaluateManifestProperty(Qor4Code("XXXX"), ref, 0, &check), 0);
  EXPECT_EQ(capture.Lines(), (std::vector<log::Line>{{Level::Debug, "Unhandled manifest tag: XXXX"}}));
}

// Identity numbers stored as reals: only those an integer can hold convert.
TEST(IdentityValue, RealsOutsideTheIntegerRangeAnswerNone) {
  const std::pair<double, std::optional<uint64_t>> cases[] = {
      {8.0, 8},
      {-1.0, UINT64_MAX},
      {18446744073709549568.0, 18446744073709549568ull},
      {18446744073709551616.0, std::nullopt},
      {-1e300, std::nullopt},
      {std::numeric_limits<double>::quiet_NaN(), std::nullopt},
      {std::numeric_limits<double>::infinity(), std::nullopt},
  };
  for (const auto& [real, expected] : cases) {
    EXPECT_EQ(device::IdentityValue(plist::Value::Real(real)).int64(), expected) << real;
  }
}

}  // namespace
}  // namespace brisvale::verify
