// Shared by the container tests: a realistic manifest built with the DER writer, and
// slot functions that record their calls and return what a test asks for.
#pragma once

#include <cstdint>
#include <cstring>
#include <vector>

#include "derwriter/der_writer.h"
#include "verify/container/qor4.h"

namespace brisvale::testing_support {

using derwriter::Bytes;

inline std::vector<Bytes> DefaultManifestProperties() {
  using namespace derwriter;
  return {DataProperty("BNCH", Bytes{1, 2, 3, 4, 5, 6, 7, 8}), IntegerProperty("BORD", 0x10),
          IntegerProperty("CHIP", 0x8020), BooleanProperty("CPRO", true), BooleanProperty("CSEC", false),
          IntegerProperty("ECID", 0x1122334455667788ull), IntegerProperty("SDOM", 1)};
}

inline Bytes DefaultBody() {
  using namespace derwriter;
  return ManifestBody(DefaultManifestProperties(),
                      {{"krnl", {IntegerProperty("ESEC", 1)}},
                       {"pdmg", {DataProperty("DGST", Bytes(48, 0xD5)),
                                 StringProperty("pdnm", "DebugDiskImage"), BooleanProperty("EKEY", true)}}});
}

inline Bytes DefaultManifest(const Bytes& body = DefaultBody()) {
  return derwriter::Manifest(body, Bytes(256, 0x5E), {Bytes{0x30, 0x00}, Bytes{0x30, 0x00}});
}

inline Bytes DefaultContainer() {
  using namespace derwriter;
  return Container(Payload("pdmg", "1.0", Bytes(100, 0xAB), Bytes{9, 9},
                           CompressionInfo{1, 4096}),
                   DefaultManifest(), RestoreInfo({BooleanProperty("RDSK", true)}));
}

// Non-allocating stand-in digest: FNV-1a, its state repeated over the output.
inline int FakeDigest(const uint8_t* data, uint32_t length, uint8_t* output,
                      uint32_t outputLength) {
  uint64_t state = 0xcbf29ce484222325ull;
  for (uint32_t i = 0; i < length; i++) state = (state ^ data[i]) * 0x100000001b3ull;
  for (uint32_t i = 0; i < outputLength; i++) output[i] = static_cast<uint8_t>(state >> (8 * (i % 8)));
  return 0;
}

// What the fake slots do and saw. Tests reset it through Slots().
struct SlotState {
  int digestResult = 0, chainResult = 0, signatureResult = 0, certificateResult = 0;
  bool useRealCertificateEvaluation = false;
  Bytes certificateProperties;  // what the chain slot hands over as the leaf's constraints
  int chainCalls = 0, signatureCalls = 0, certificateCalls = 0;
  uint8_t signedDigest[kQor4MaxDigestLength] = {};
};

inline SlotState& Slots() {
  static SlotState state;
  return state;
}

inline int SlotComputeDigest(const uint8_t* data, uint32_t length, uint8_t* output,
                             uint32_t outputLength, const Qor4SecureBootParams*) {
  return Slots().digestResult != 0 ? Slots().digestResult : FakeDigest(data, length, output, outputLength);
}

inline int SlotVerifyChain(const uint8_t* chain, uint32_t chainLength, const uint8_t** key,
                           uint32_t* keyLength, const uint8_t** properties,
                           uint32_t* propertiesLength, const Qor4SecureBootParams*, void*) {
  Slots().chainCalls++;
  if (Slots().chainResult != 0) return Slots().chainResult;
  *key = chain;
  *keyLength = chainLength;
  *properties = Slots().certificateProperties.empty() ? nullptr : Slots().certificateProperties.data();
  *propertiesLength = static_cast<uint32_t>(Slots().certificateProperties.size());
  return 0;
}

inline int SlotVerifySignature(const uint8_t*, uint32_t, const uint8_t*, uint32_t,
                               const uint8_t* digest, uint32_t digestLength,
                               const Qor4SecureBootParams*, void*) {
  Slots().signatureCalls++;
  std::memcpy(Slots().signedDigest, digest, digestLength);
  return Slots().signatureResult;
}

inline int SlotEvaluateCertificateProperties(Qor4DecodeContext* context, void* callbackContext) {
  Slots().certificateCalls++;
  if (Slots().useRealCertificateEvaluation) {
    return Qor4DecodeEvaluateCertificateProperties(context, callbackContext);
  }
  return Slots().certificateResult;
}

inline constexpr Qor4DigestInfo kFakeDigestInfo48 = {48, nullptr, std::nullopt};

inline constexpr Qor4SecureBootParams kFakeParams = {
    SlotComputeDigest, SlotVerifyChain, SlotVerifySignature, SlotEvaluateCertificateProperties,
    &kFakeDigestInfo48, nullptr, nullptr};

}  // namespace brisvale::testing_support
