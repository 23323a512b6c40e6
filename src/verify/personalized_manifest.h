// The personalized image check: a signed-container manifest issued for one device is
// accepted when its chain and signature verify, every identity property it names
// matches this device, and its "pdmg" digest matches the image.
#pragma once

#include <cstdint>
#include <span>

#include "platform/device_properties.h"
#include "verify/container/qor4.h"

namespace brisvale::verify {

// What EvaluateManifestProperty compares against: the image digest and the device's
// identity as read once for this manifest.
struct ManifestCheckContext {
  std::span<const uint8_t> imageDigest;
  const device::DeviceIdentity* identity;
};

// 0 when the manifest is valid for this device and this image digest; -1 after logging
// why. Reads the device identity once.
int VerifyPersonalizedManifest(std::span<const uint8_t> manifest,
                               std::span<const uint8_t> imageDigest);

// The property callback of the trust evaluation; `context` is a ManifestCheckContext.
// 0 accepts the property, -1 rejects it (after logging the tag).
int EvaluateManifestProperty(uint32_t tag, Qor4PropertyRef property, uint32_t dictionaryKind,
                             void* context);

}  // namespace brisvale::verify
