// The first byte picks the chain verifier; the rest is the manifest's certificate chain.
#include <cstddef>
#include <cstdint>

#include "verify/chain/secure_boot.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  using namespace brisvale;
  if (size < 1 || size > UINT32_MAX) return 0;
  struct Variant {
    Qor4VerifyChainFunction verify;
    const Qor4SecureBootParams* params;
  };
  static const Variant kVariants[] = {
      {verify_chain_qor4_v1, &kQor4DecodeSecureBootRsa1kSha1},
      {verify_chain_qor4_v2, &kQor4DecodeSecureBootRsa4kSha384},
      {verify_chain_qor4_ecdsa256, &kQor4DecodeSecureBootEc384Sha384},
  };
  const Variant& variant = kVariants[data[0] % 3];
  const uint8_t* key = nullptr;
  uint32_t keyLength = 0;
  const uint8_t* constraints = nullptr;
  uint32_t constraintsLength = 0;
  if (variant.verify(data + 1, static_cast<uint32_t>(size - 1), &key, &keyLength, &constraints,
                     &constraintsLength, variant.params, nullptr) == 0) {
    // Outputs point into the input.
    if (key < data + 1 || key + keyLength > data + size) __builtin_trap();
  }
  return 0;
}
