// The manifest and certificate signature checks behind the parameter sets' slots.
#include <span>

#include "platform/crypto.h"
#include "verify/chain/secure_boot.h"

namespace brisvale {
namespace {

std::span<const uint8_t> Significant(const DERItem& integer) {
  std::span<const uint8_t> bytes(integer.data, integer.length);
  while (!bytes.empty() && bytes.front() == 0) bytes = bytes.subspan(1);
  return bytes;
}

}  // namespace

int verify_signature_rsa(const uint8_t* publicKey, uint32_t publicKeyLength,
                         const uint8_t* signature, uint32_t signatureLength,
                         const uint8_t* digest, uint32_t digestLength,
                         const Qor4SecureBootParams* params, void*) {
  if (!publicKey || publicKeyLength == 0 || !signature || signatureLength == 0 || !digest ||
      digestLength == 0 || !params || !params->digestInfo || !params->digestInfo->algorithm) {
    return -1;
  }
  crypto::DigestAlgorithm algorithm = *params->digestInfo->algorithm;
  if (crypto::DigestLength(algorithm) != digestLength) return -1;

  const DERItem keyItem{publicKey, publicKeyLength};
  DERRSAPubKeyPKCS1 key;
  if (DERParseSequence(&keyItem, DERNumRSAPubKeyPKCS1ItemSpecs, DERRSAPubKeyPKCS1ItemSpecs, &key,
                       sizeof(key)) != DERResultSuccess) {
    return -1;
  }
  std::span<const uint8_t> modulus = Significant(key.modulus);
  std::span<const uint8_t> exponent = Significant(key.pubExponent);
  // Room for 128 32-bit words: a 4096-bit modulus.
  constexpr size_t kMaxModulusWords = 128;
  if ((modulus.size() + 3) / 4 > kMaxModulusWords || exponent.size() > modulus.size()) return -1;
  return crypto::VerifyRsaPkcs1(modulus, exponent, algorithm, {digest, digestLength},
                                {signature, signatureLength})
             ? 0
             : -1;
}

int verify_signature_ecdsa(const uint8_t* publicKey, uint32_t publicKeyLength,
                           const uint8_t* signature, uint32_t signatureLength,
                           const uint8_t* digest, uint32_t digestLength,
                           const Qor4SecureBootParams* params, void*) {
  if (!publicKey || publicKeyLength == 0 || !signature || signatureLength == 0 || !digest ||
      digestLength == 0 || !params || !params->digestInfo || !params->digestInfo->algorithm ||
      !params->keyAlgorithm || params->digestInfo->digestLength != digestLength) {
    return -1;
  }
  return crypto::VerifyEcdsa({publicKey, publicKeyLength}, {digest, digestLength},
                             {signature, signatureLength})
             ? 0
             : -1;
}

}  // namespace brisvale
