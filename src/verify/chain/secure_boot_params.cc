// Object identifiers, digest infos and the parameter sets, with the digest functions.
#include <span>

#include "platform/crypto.h"
#include "verify/chain/secure_boot.h"

namespace brisvale {
namespace {

const uint8_t kSha1[] = {0x2B, 0x0E, 0x03, 0x02, 0x1A};
const uint8_t kSha256[] = {0x60, 0x86, 0x48, 0x01, 0x65, 0x03, 0x04, 0x02, 0x01};
const uint8_t kSha384[] = {0x60, 0x86, 0x48, 0x01, 0x65, 0x03, 0x04, 0x02, 0x02};
const uint8_t kRsa[] = {0x2A, 0x86, 0x48, 0x86, 0xF7, 0x0D, 0x01, 0x01, 0x01};
const uint8_t kSha1Rsa[] = {0x2A, 0x86, 0x48, 0x86, 0xF7, 0x0D, 0x01, 0x01, 0x05};
const uint8_t kSha256Rsa[] = {0x2A, 0x86, 0x48, 0x86, 0xF7, 0x0D, 0x01, 0x01, 0x0B};
const uint8_t kSha384Rsa[] = {0x2A, 0x86, 0x48, 0x86, 0xF7, 0x0D, 0x01, 0x01, 0x0C};
const uint8_t kEcPubKey[] = {0x2A, 0x86, 0x48, 0xCE, 0x3D, 0x02, 0x01};
const uint8_t kSha256Ecdsa[] = {0x2A, 0x86, 0x48, 0xCE, 0x3D, 0x04, 0x03, 0x02};
const uint8_t kSha384Ecdsa[] = {0x2A, 0x86, 0x48, 0xCE, 0x3D, 0x04, 0x03, 0x03};
const uint8_t kSha512Ecdsa[] = {0x2A, 0x86, 0x48, 0xCE, 0x3D, 0x04, 0x03, 0x04};
const uint8_t kEcPrime192v1[] = {0x2A, 0x86, 0x48, 0xCE, 0x3D, 0x03, 0x01, 0x01};
const uint8_t kEcPrime256v1[] = {0x2A, 0x86, 0x48, 0xCE, 0x3D, 0x03, 0x01, 0x07};
const uint8_t kAnsip384r1[] = {0x2B, 0x81, 0x04, 0x00, 0x22};
const uint8_t kAnsip521r1[] = {0x2B, 0x81, 0x04, 0x00, 0x23};
const uint8_t kCommonName[] = {0x55, 0x04, 0x03};

template <size_t N>
constexpr DERItem Item(const uint8_t (&bytes)[N]) {
  return DERItem{bytes, N};
}

}  // namespace

const DERItem oidSha1 = Item(kSha1);
const DERItem oidSha256 = Item(kSha256);
const DERItem oidSha384 = Item(kSha384);
const DERItem oidRsa = Item(kRsa);
const DERItem oidSha1Rsa = Item(kSha1Rsa);
const DERItem oidSha256Rsa = Item(kSha256Rsa);
const DERItem oidSha384Rsa = Item(kSha384Rsa);
const DERItem oidEcPubKey = Item(kEcPubKey);
const DERItem oidSha256Ecdsa = Item(kSha256Ecdsa);
const DERItem oidSha384Ecdsa = Item(kSha384Ecdsa);
const DERItem oidSha512Ecdsa = Item(kSha512Ecdsa);
const DERItem oidEcPrime192v1 = Item(kEcPrime192v1);
const DERItem oidEcPrime256v1 = Item(kEcPrime256v1);
const DERItem oidAnsip384r1 = Item(kAnsip384r1);
const DERItem oidAnsip521r1 = Item(kAnsip521r1);
const DERItem oidCommonName = Item(kCommonName);

const Qor4DigestInfo kVelmoreDigestInfoSha1 = {20, &oidSha1, crypto::DigestAlgorithm::Sha1};
const Qor4DigestInfo kVelmoreDigestInfoSha256 = {32, &oidSha256, std::nullopt};
const Qor4DigestInfo kVelmoreDigestInfoSha384 = {48, &oidSha384, crypto::DigestAlgorithm::Sha384};

const Qor4SecureBootParams kQor4DecodeSecureBootRsa1kSha1 = {
    Qor4DecodeComputeDigest, verify_chain_qor4_v1, verify_signature_rsa,
    Qor4DecodeEvaluateCertificateProperties, &kVelmoreDigestInfoSha1, &oidSha1Rsa, &oidRsa};
const Qor4SecureBootParams kQor4DecodeSecureBootRsa4kSha384 = {
    Qor4DecodeComputeDigest, verify_chain_qor4_v2, verify_signature_rsa,
    Qor4DecodeEvaluateCertificateProperties, &kVelmoreDigestInfoSha384, &oidSha384Rsa, &oidRsa};
const Qor4SecureBootParams kQor4DecodeSecureBootEc192Sha256 = {
    Qor4DecodeComputeDigest, verify_chain_qor4_ecdsa256, verify_signature_ecdsa,
    Qor4DecodeEvaluateCertificateProperties, &kVelmoreDigestInfoSha256, &oidSha256Ecdsa,
    &oidEcPrime192v1};
const Qor4SecureBootParams kQor4DecodeSecureBootEc256Sha256 = {
    Qor4DecodeComputeDigest, verify_chain_qor4_ecdsa256, verify_signature_ecdsa,
    Qor4DecodeEvaluateCertificateProperties, &kVelmoreDigestInfoSha256, &oidSha256Ecdsa,
    &oidEcPrime256v1};
const Qor4SecureBootParams kQor4DecodeSecureBootEc384Sha384 = {
    Qor4DecodeComputeDigest, verify_chain_qor4_ecdsa256, verify_signature_ecdsa,
    Qor4DecodeEvaluateCertificateProperties, &kVelmoreDigestInfoSha384, &oidSha384Ecdsa,
    &oidAnsip384r1};
// Pairs the SHA-512 ECDSA OID with the 48-byte SHA-384 digest info; nothing selects it.
const Qor4SecureBootParams kQor4DecodeSecureBootEc521Sha512 = {
    Qor4DecodeComputeDigest, verify_chain_qor4_ecdsa256, verify_signature_ecdsa,
    Qor4DecodeEvaluateCertificateProperties, &kVelmoreDigestInfoSha384, &oidSha512Ecdsa,
    &oidAnsip521r1};

void sha1_digest(const uint8_t* data, uint32_t length, uint8_t* output) {
  if (!output || (!data && length != 0)) return;
  crypto::Digest(crypto::DigestAlgorithm::Sha1, {data, length}, {output, crypto::kSha1Length});
}

int Qor4DecodeComputeDigest(const uint8_t* data, uint32_t length, uint8_t* output,
                            uint32_t outputLength, const Qor4SecureBootParams* params) {
  if (!data || length == 0 || !output || !params || !params->digestInfo ||
      !params->digestInfo->algorithm) {
    return -1;
  }
  const Qor4DigestInfo& info = *params->digestInfo;
  if (outputLength != info.digestLength || outputLength != crypto::DigestLength(*info.algorithm)) {
    return -1;
  }
  return crypto::Digest(*info.algorithm, {data, length}, {output, outputLength}) ? 0 : -1;
}

}  // namespace brisvale
