// Qor4DecodeInit, Qor4DecodeInitManifest and a full trust evaluation with permissive
// slot functions over arbitrary bytes. The first byte picks the entry point.
#include <cstddef>
#include <cstdint>
#include <cstring>

#include "verify/container/qor4.h"

using namespace brisvale;

namespace {

// Certificate constraints come from the input too, so that their checks run.
thread_local DERItem g_constraints;

int Digest(const uint8_t* data, uint32_t length, uint8_t* out, uint32_t outLength,
           const Qor4SecureBootParams*) {
  uint8_t sum = 0;
  for (uint32_t i = 0; i < length; i++) sum = static_cast<uint8_t>(sum * 31 + data[i]);
  std::memset(out, sum, outLength);
  return 0;
}

int Chain(const uint8_t* chain, uint32_t length, const uint8_t** key, uint32_t* keyLength,
          const uint8_t** properties, uint32_t* propertiesLength, const Qor4SecureBootParams*,
          void*) {
  *key = chain;
  *keyLength = length;
  *properties = g_constraints.data;
  *propertiesLength = g_constraints.length;
  return 0;
}

int Signature(const uint8_t*, uint32_t, const uint8_t*, uint32_t, const uint8_t* digest,
              uint32_t digestLength, const Qor4SecureBootParams*, void*) {
  volatile uint8_t touch = digestLength ? digest[digestLength - 1] : 0;
  (void)touch;
  return 0;
}

int Constraints(Qor4DecodeContext* context, void* callbackContext) {
  Qor4DecodeEvaluateCertificateProperties(context, callbackContext);
  return 0;  // permissive: go on to the property walk whatever the constraints say
}

int ReadEveryValue(uint32_t tag, Qor4PropertyRef property, uint32_t, void*) {
  bool flag;
  uint32_t small;
  uint64_t number;
  const uint8_t* data;
  uint32_t length;
  Qor4DecodeGetPropertyBoolean(&property.encoding, tag, 0, &flag);
  Qor4DecodeGetPropertyInteger(&property.encoding, tag, 0, &small);
  Qor4DecodeGetPropertyInteger64(&property.encoding, tag, 0, &number);
  if (Qor4DecodeGetPropertyData(&property.encoding, tag, 0, &data, &length) == 0 && length) {
    volatile uint8_t touch = data[length - 1];
    (void)touch;
  }
  return 0;
}

const uint8_t* Stored(const Qor4DecodeContext*, void*) { return nullptr; }

constexpr Qor4DigestInfo kInfo = {48, nullptr, std::nullopt};
constexpr Qor4SecureBootParams kParams = {Digest, Chain, Signature, Constraints, &kInfo, nullptr,
                                          nullptr};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 3 || size > UINT32_MAX) return 0;
  const uint8_t mode = data[0];
  // Bytes 1-2: how much of the rest is the constraint SET (taken from the end).
  const uint32_t constraintLength = (uint32_t{data[1]} << 8 | data[2]) % (size - 2);
  const uint8_t* body = data + 3;
  const uint32_t bodyLength = static_cast<uint32_t>(size - 3 - constraintLength);
  g_constraints = {body + bodyLength, constraintLength};

  Qor4DecodeContext context{};
  int result = (mode & 1) ? Qor4DecodeInitManifest(body, bodyLength, &context)
                          : Qor4DecodeInit(body, bodyLength, &context);
  uint32_t total;
  Qor4DecodeParseLengthFromBuffer(body, bodyLength, &total);
  if (result != 0) return 0;

  DERItem item;
  uint32_t a, b;
  Qor4DecodeGetPayloadType(&context, &a);
  Qor4DecodeGetPayloadCompressionInfo(&context, &a, &b);
  Qor4DecodeGetDataFromSection(&context, 0, Qor4Code("BNCH"), 0, &item);
  Qor4DecodeGetRestoreInfoInteger(&context, Qor4Code("RDSK"), 0, &a);
  const uint8_t* bytes;
  Qor4DecodeGetObjectPropertyData(&context, Qor4Code("pdmg"), 0, Qor4Code("DGST"), 0, &bytes, &a);

  const Qor4PropertyCallbacks callbacks = {ReadEveryValue, (mode & 2) ? Stored : nullptr};
  Qor4DecodePerformTrustEvaluatationWithCallbacks(Qor4Code("pdmg"), &context, &callbacks, &kParams,
                                                  nullptr);
  uint8_t digest[48];
  Qor4DecodeCopyManifestDigest(&context, digest, sizeof digest, &kParams);
  Qor4DecodeCopyPayloadDigest(&context, digest, sizeof digest, &kParams);
  return 0;
}
