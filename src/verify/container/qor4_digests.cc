// Digests of the payload and manifest encodings, served from the context's cache when
// a trust evaluation has already computed them.
#include <cstring>
#include <span>

#include "platform/crypto.h"
#include "verify/container/qor4.h"

namespace brisvale {

namespace {

constexpr uint32_t kSha1Length = crypto::kSha1Length;

struct Section {
  bool present;
  const DERItem& encoding;
  uint8_t cacheValid;
  const uint8_t* cache;
};

Section PayloadSection(const Qor4DecodeContext& context) {
  return {Qor4DecodePayloadExists(&context), context.payloadEncoding, context.payloadHashValid,
          context.payloadHash};
}

Section ManifestSection(const Qor4DecodeContext& context) {
  return {Qor4DecodeManifestExists(&context), context.manifestEncoding,
          context.manifestHashValid, context.manifestHash};
}

int CopySha1(const Section& section, uint8_t* output, uint32_t outputSize) {
  if (outputSize != kSha1Length) return DERResultParamError;
  if (!section.present) return DERResultEndOfSequence;
  if (section.cacheValid) {
    std::memcpy(output, section.cache, kSha1Length);
    return DERResultSuccess;
  }
  const bool digested = crypto::Digest(
      crypto::DigestAlgorithm::Sha1,
      std::span<const uint8_t>(section.encoding.data, section.encoding.length),
      std::span<uint8_t>(output, outputSize));
  return digested ? int{DERResultSuccess} : -1;
}

int CopyWithCallback(const Section& section, Qor4HashFunction hash, uint8_t* output,
                     uint32_t outputSize) {
  if (outputSize != kSha1Length) return DERResultParamError;
  if (!section.present) return DERResultEndOfSequence;
  if (section.cacheValid) {
    std::memcpy(output, section.cache, kSha1Length);
  } else {
    hash(section.encoding.data, section.encoding.length, output);
  }
  return DERResultSuccess;
}

int CopyDigest(const Section& section, uint8_t* output, uint32_t outputLength,
               const Qor4SecureBootParams* params) {
  if (params->computeDigest == nullptr) return DERResultParamError;
  if (!section.present) return DERResultEndOfSequence;
  if (section.cacheValid) {
    if (outputLength > kQor4MaxDigestLength) return DERResultOverflow;
    std::memcpy(output, section.cache, outputLength);
    return DERResultSuccess;
  }
  return params->computeDigest(section.encoding.data, section.encoding.length, output,
                               outputLength, params);
}

}  // namespace

int Qor4DecodeCopyPayloadHash(Qor4DecodeContext* context, uint8_t* output, uint32_t outputSize) {
  if (context == nullptr || output == nullptr) return DERResultParamError;
  return CopySha1(PayloadSection(*context), output, outputSize);
}

int Qor4DecodeCopyPayloadHashWithCallback(Qor4DecodeContext* context, Qor4HashFunction hash,
                                          uint8_t* output, uint32_t outputSize) {
  if (context == nullptr || hash == nullptr || output == nullptr) return DERResultParamError;
  return CopyWithCallback(PayloadSection(*context), hash, output, outputSize);
}

int Qor4DecodeCopyPayloadDigest(Qor4DecodeContext* context, uint8_t* output,
                                uint32_t outputLength, const Qor4SecureBootParams* params) {
  if (context == nullptr || output == nullptr || params == nullptr) return DERResultParamError;
  return CopyDigest(PayloadSection(*context), output, outputLength, params);
}

int Qor4DecodeCopyManifestHash(Qor4DecodeContext* context, uint8_t* output, uint32_t outputSize) {
  if (context == nullptr || output == nullptr) return DERResultParamError;
  return CopySha1(ManifestSection(*context), output, outputSize);
}

int Qor4DecodeCopyManifestHashWithCallback(Qor4DecodeContext* context, Qor4HashFunction hash,
                                           uint8_t* output, uint32_t outputSize) {
  if (context == nullptr || hash == nullptr || output == nullptr) return DERResultParamError;
  return CopyWithCallback(ManifestSection(*context), hash, output, outputSize);
}

int Qor4DecodeCopyManifestDigest(Qor4DecodeContext* context, uint8_t* output,
                                 uint32_t outputLength, const Qor4SecureBootParams* params) {
  if (context == nullptr || output == nullptr || params == nullptr) return DERResultParamError;
  return CopyDigest(ManifestSection(*context), output, outputLength, params);
}

}  // namespace brisvale
