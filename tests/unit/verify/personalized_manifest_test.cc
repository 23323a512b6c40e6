// The personalized manifest check against the device identity and the image digest.
#include "verify/personalized_manifest.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <limits>

#include "base/log.h"
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

// The device's options, each "--option value" pair of `overrides` replacing or added.
Args Merge(Args merged, const Args& overrides) {
  for (size_t i = 0; i + 1 < overrides.size(); i += 2) {
    auto found = std::find(merged.begin(), merged.end(), overrides[i]);
    if (found == merged.end()) found = merged.insert(merged.end(), {overrides[i], ""});
    *(found + 1) = overrides[i + 1];
  }
  return merged;
}

// The two lines of a manifest tag that does not match the device or the image.
Lines TagRefused(const std::string& tag) {
  return {"Failed to validate manifest tag: " + tag, "Failed to evaluate trust: -1"};
}

TEST(VerifyPersonalizedManifest, ChecksDeviceAndImage) {
  const Lines untrusted = {"Failed to evaluate trust: -1"};
  // `manifest`: options beyond the device's own values and the image; `lines`: the default-level
  // lines; `hashMethod`: nullptr when none is recorded; `digestLength`: how the image is digested
  // before the check; `numbers`: the identity stores its modes as integers.
  struct Case {
    const char* name; Args manifest; int result; Lines lines;
    const char* hashMethod = "sha384"; long digestLength = 48; bool numbers = false;
  } cases[] = {
      {"Sha384Matches", {}, 0, {}},
      {"Sha1Matches", {"--chain", "sha1", "--dgst", "sha1"}, 0, {}, "sha1", 20},
      {"ModesAsIntegers", {}, 0, {}, "sha384", 48, true},
      {"EcidHighBitsCount", {"--ecid", "0x0000000055667788"}, -1, TagRefused("ECID")},
      {"OtherBoard", {"--board", "9"}, -1, TagRefused("BORD")},
      {"OtherNonce", {"--nonce", "00"}, -1, TagRefused("BNCH")},
      {"OtherImage", {"--dgst", "hex:" + std::string(96, '0')}, -1, TagRefused("DGST")},
      {"EkeyFalse", {"--ekey", "false"}, -1, TagRefused("EKEY")},
      {"SdomZero", {"--sdom", "0"}, -1, TagRefused("SDOM")},
      {"ProductionDiffers", {"--production", "false"}, -1, TagRefused("CPRO")},
      // The leaf pins another chip: its constraint fails before any tag rule runs.
      {"PinnedValueBroken", {"--leaf-constraint", "CHIP=int:1"}, -1, untrusted},
      // A leaf without the constraint extension has nothing to evaluate: a decode error.
      {"LeafWithoutConstraintExtension", {"--leaf", "plain"}, -1, {"Failed to evaluate trust: 3"}},
      // Only "sha1" exactly selects the SHA-1 chain.
      {"UpperCaseSha1IsSha384", {}, 0, {}, "SHA1"},
      {"NoHashMethod", {}, -1, {"Failed to retrieve Qor4CryptoHashMethod."}, nullptr},
      {"NoDiskImageObject", {"--object", "pdmX"}, -1, {"Failed to evaluate trust: 1"}},
  };
  testing::ScratchDir dir;
  const std::string image = (dir / "image").string(), identityFile = (dir / "identity.plist").string();
  testing::WriteFileBytes(image, testing::Bytes(70000, 0xA5));
  device::SetDeviceIdentityPath(identityFile);
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    Args identity = Merge({"identity", "-o", identityFile}, kDevice);
    if (c.hashMethod) identity.insert(identity.end(), {"--hash-method", c.hashMethod});
    if (c.numbers) identity.push_back("--numbers");
    const Args manifest =
        Merge({"manifest", "--image", image, "-o", (dir / "manifest").string()}, Merge(kDevice, c.manifest));
    std::vector<uint8_t> digest;
    EXPECT_TRUE(testing::RunImgtool(identity) && testing::RunImgtool(manifest));
    EXPECT_EQ(DigestImageFile(image, &digest, c.digestLength), 0);
    log::CaptureSink capture;
    EXPECT_EQ(VerifyPersonalizedManifest(testing::ReadFileBytes(dir / "manifest"), digest), c.result);
    EXPECT_EQ(capture.Texts(Level::Default), c.lines);
    // The object's name has no rule: accepted with a note (each refusal here comes before it).
    EXPECT_EQ(capture.Contains(Level::Debug, "Unhandled manifest tag: pdnm"), c.result == 0);
  }
  device::SetDeviceIdentityPath("");
}

TEST(VerifyPersonalizedManifest, UndecodableManifestFailsFirst) {
  log::CaptureSink capture;
  EXPECT_EQ(VerifyPersonalizedManifest(testing::Bytes{0x31, 0x00}, std::vector<uint8_t>(48)), -1);
  EXPECT_EQ(capture.Texts(), Lines{"Failed to initialize qor4 manifest: 2"});
}

// Identity numbers stored as reals: only those an integer can hold convert.
TEST(IdentityValue, RealsOutsideTheIntegerRangeAnswerNone) {
  const std::pair<double, std::optional<uint64_t>> cases[] = {
      {-1.0, UINT64_MAX},
      {18446744073709549568.0, 18446744073709549568ull},
      {18446744073709551616.0, std::nullopt},
      {std::numeric_limits<double>::quiet_NaN(), std::nullopt},
  };
  for (const auto& [real, expected] : cases) {
    EXPECT_EQ(device::IdentityValue(plist::Value::Real(real)).int64(), expected) << real;
  }
}

}  // namespace
}  // namespace brisvale::verify
