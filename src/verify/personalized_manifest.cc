#include "verify/personalized_manifest.h"

#include <algorithm>
#include <cstdint>
#include <limits>
#include <optional>
#include <string>

#include "base/log.h"
#include "verify/chain/secure_boot.h"

namespace brisvale::verify {
namespace {

constexpr uint32_t kDiskImageObject = Qor4Code("pdmg");

std::string TagText(uint32_t tag) {
  return std::string{static_cast<char>(tag >> 24), static_cast<char>(tag >> 16),
                     static_cast<char>(tag >> 8), static_cast<char>(tag)};
}

std::optional<device::IdentityValue> Number(const ManifestCheckContext& check, const char* key) {
  std::optional<device::IdentityValue> value = check.identity->Copy(key);
  if (!value || value->kind() != device::ValueKind::Number) return std::nullopt;
  return value;
}

bool MatchesInteger(const DERItem& encoding, uint32_t tag, const ManifestCheckContext& check,
                    const char* key) {
  uint32_t manifestValue = 0;
  if (Qor4DecodeGetPropertyInteger(&encoding, tag, 0, &manifestValue) != DERResultSuccess) {
    return false;
  }
  std::optional<device::IdentityValue> deviceValue = Number(check, key);
  return deviceValue && deviceValue->int32() == manifestValue;
}

bool MatchesBoolean(const DERItem& encoding, uint32_t tag, const ManifestCheckContext& check,
                    const char* key) {
  bool manifestValue = false;
  if (Qor4DecodeGetPropertyBoolean(&encoding, tag, 0, &manifestValue) != DERResultSuccess) {
    return false;
  }
  std::optional<device::IdentityValue> deviceValue = Number(check, key);
  return deviceValue && deviceValue->boolean() == manifestValue;
}

// Whether the property satisfies its tag's rule; none for a tag without a rule.
std::optional<bool> CheckProperty(uint32_t tag, const DERItem& encoding,
                                  const ManifestCheckContext& check) {
  switch (tag) {
    case Qor4Code("BNCH"): {
      const uint8_t* data = nullptr;
      uint32_t length = 0;
      if (Qor4DecodeGetPropertyData(&encoding, tag, 0, &data, &length) != DERResultSuccess) {
        return false;
      }
      std::optional<device::IdentityValue> nonce = check.identity->Copy("ApNonce");
      return nonce && nonce->kind() == device::ValueKind::Data &&
             nonce->DataEquals({data, length});
    }
    case Qor4Code("BORD"): return MatchesInteger(encoding, tag, check, "BoardId");
    case Qor4Code("CHIP"): return MatchesInteger(encoding, tag, check, "ChipID");
    case Qor4Code("CPRO"): return MatchesBoolean(encoding, tag, check, "CertificateProductionStatus");
    case Qor4Code("CSEC"): return MatchesBoolean(encoding, tag, check, "CertificateSecurityMode");
    case Qor4Code("EPRO"): return MatchesBoolean(encoding, tag, check, "EffectiveProductionStatusAp");
    case Qor4Code("ESEC"): return MatchesBoolean(encoding, tag, check, "EffectiveSecurityModeAp");
    case Qor4Code("DGST"): {
      const uint8_t* data = nullptr;
      uint32_t length = 0;
      if (Qor4DecodeGetPropertyData(&encoding, tag, 0, &data, &length) != DERResultSuccess) {
        return false;
      }
      return std::equal(data, data + length, check.imageDigest.begin(), check.imageDigest.end());
    }
    case Qor4Code("ECID"): {
      uint64_t manifestValue = 0;
      if (Qor4DecodeGetPropertyInteger64(&encoding, tag, 0, &manifestValue) != DERResultSuccess) {
        return false;
      }
      std::optional<device::IdentityValue> ecid = Number(check, "UniqueChipID");
      return ecid && ecid->int64() == manifestValue;
    }
    case Qor4Code("EKEY"): {
      bool value = false;
      return Qor4DecodeGetPropertyBoolean(&encoding, tag, 0, &value) == DERResultSuccess && value;
    }
    case Qor4Code("SDOM"): {
      uint32_t value = 0;
      return Qor4DecodeGetPropertyInteger(&encoding, tag, 0, &value) == DERResultSuccess &&
             value == 1;
    }
    default: return std::nullopt;
  }
}

}  // namespace

int EvaluateManifestProperty(uint32_t tag, Qor4PropertyRef property, uint32_t, void* context) {
  const auto* check = static_cast<const ManifestCheckContext*>(context);
  std::string tagText = TagText(tag);
  if (!check || !check->identity) {
    Log(Level::Default, "Failed to validate manifest tag: %s", tagText);
    return -1;
  }
  std::optional<bool> valid = CheckProperty(tag, property.encoding, *check);
  if (!valid) {
    Log(Level::Debug, "Unhandled manifest tag: %s", tagText);
    return 0;
  }
  if (!*valid) {
    Log(Level::Default, "Failed to validate manifest tag: %s", tagText);
    return -1;
  }
  return 0;
}

int VerifyPersonalizedManifest(std::span<const uint8_t> manifest,
                               std::span<const uint8_t> imageDigest) {
  Qor4DecodeContext context{};
  const Qor4SecureBootParams* params = &kQor4DecodeSecureBootRsa4kSha384;

  int result = manifest.size() > std::numeric_limits<uint32_t>::max()
                   ? static_cast<int>(DERResultOverflow)
                   : Qor4DecodeInitManifest(manifest.data(),
                                            static_cast<uint32_t>(manifest.size()), &context);
  if (result != 0) {
    Log(Level::Default, "Failed to initialize qor4 manifest: %d", result);
    return -1;
  }

  device::DeviceIdentity identity = device::ReadDeviceIdentity();
  constexpr const char* kHashMethodKey = "Qor4CryptoHashMethod";
  std::optional<device::IdentityValue> hashMethod = identity.Copy(kHashMethodKey);
  if (!hashMethod || hashMethod->kind() != device::ValueKind::Text) {
    Log(Level::Default, "Failed to retrieve %@.", kHashMethodKey);
    return -1;
  }
  if (*hashMethod->text() == "sha1") params = &kQor4DecodeSecureBootRsa1kSha1;

  ManifestCheckContext check{imageDigest, &identity};
  const Qor4PropertyCallbacks callbacks{EvaluateManifestProperty, nullptr};
  result = Qor4DecodePerformTrustEvaluatationWithCallbacks(kDiskImageObject, &context, &callbacks,
                                                           params, &check);
  if (result != 0) {
    Log(Level::Default, "Failed to evaluate trust: %d", result);
    return -1;
  }
  return 0;
}

}  // namespace brisvale::verify
