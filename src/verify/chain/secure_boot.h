// The cryptographic half of the signed-container trust evaluation: the digest infos and
// parameter sets, certificate-chain verification against the compiled-in roots, and
// verification of the manifest signature with the leaf's key. Every verifier returns 0
// or -1 and logs nothing; outputs are written only on success. Nothing here allocates:
// certificates are parsed in place and keys and digests live in fixed local storage.
#pragma once

#include <cstdint>

#include "verify/container/qor4.h"
#include "verify/der/der.h"
#include "verify/der/der_item_specs.h"

namespace brisvale {

// Object identifiers (content octets).
extern const DERItem oidSha1;
extern const DERItem oidSha256;
extern const DERItem oidSha384;
extern const DERItem oidRsa;
extern const DERItem oidSha1Rsa;
extern const DERItem oidSha256Rsa;
extern const DERItem oidSha384Rsa;
extern const DERItem oidEcPubKey;
extern const DERItem oidSha256Ecdsa;
extern const DERItem oidSha384Ecdsa;
extern const DERItem oidSha512Ecdsa;
extern const DERItem oidEcPrime192v1;
extern const DERItem oidEcPrime256v1;
extern const DERItem oidAnsip384r1;
extern const DERItem oidAnsip521r1;
extern const DERItem oidCommonName;

extern const Qor4DigestInfo kVelmoreDigestInfoSha1;
// Names no digest implementation: sets that use it cannot compute digests.
extern const Qor4DigestInfo kVelmoreDigestInfoSha256;
extern const Qor4DigestInfo kVelmoreDigestInfoSha384;

extern const Qor4SecureBootParams kQor4DecodeSecureBootRsa1kSha1;
extern const Qor4SecureBootParams kQor4DecodeSecureBootRsa4kSha384;
extern const Qor4SecureBootParams kQor4DecodeSecureBootEc192Sha256;
extern const Qor4SecureBootParams kQor4DecodeSecureBootEc256Sha256;
extern const Qor4SecureBootParams kQor4DecodeSecureBootEc384Sha384;
extern const Qor4SecureBootParams kQor4DecodeSecureBootEc521Sha512;

// Certificates of a chain in the RSA variants must be smaller than this.
inline constexpr uint32_t kMaxRsaChainCertificateSize = 131072;

void sha1_digest(const uint8_t* data, uint32_t length, uint8_t* output);

int Qor4DecodeComputeDigest(const uint8_t* data, uint32_t length, uint8_t* output,
                            uint32_t outputLength, const Qor4SecureBootParams* params);

// One certificate parsed in place.
struct Qor4ParsedCertificate {
  DERSignedCertCrl signedCert;
  DERTBSCert tbs;
  DERItem publicKey;        // BIT STRING bytes
  DERItem keyParameters;    // the EC curve OID element; unused for RSA
  DERItem constraints;      // manifest-constraint extension value; {null, 0} when absent
};

// RSA-variant parse of each certificate (RSA key with absent or NULL parameters, whole
// key bytes, constraints). 0 or -1.
int parse_certificates(const DERItem* certificates, uint32_t count,
                       Qor4ParsedCertificate* parsed);
// Finds the manifest-constraint extension; leaves `constraints` alone when there is none.
int find_manifest_constraints(const DERTBSCert* tbs, DERItem* constraints);
int verify_certificate_signature(const DERItem* issuerKey, const Qor4ParsedCertificate* subject,
                                 const Qor4SecureBootParams* params);

int verify_chain_qor4_v1(const uint8_t* chain, uint32_t chainLength, const uint8_t** publicKey,
                         uint32_t* publicKeyLength, const uint8_t** certificateProperties,
                         uint32_t* certificatePropertiesLength,
                         const Qor4SecureBootParams* params, void* context);
int verify_chain_qor4_v2(const uint8_t* chain, uint32_t chainLength, const uint8_t** publicKey,
                         uint32_t* publicKeyLength, const uint8_t** certificateProperties,
                         uint32_t* certificatePropertiesLength,
                         const Qor4SecureBootParams* params, void* context);
int verify_chain_qor4_ecdsa256(const uint8_t* chain, uint32_t chainLength,
                               const uint8_t** publicKey, uint32_t* publicKeyLength,
                               const uint8_t** certificateProperties,
                               uint32_t* certificatePropertiesLength,
                               const Qor4SecureBootParams* params, void* context);

// `publicKey` is a PKCS#1 RSAPublicKey.
int verify_signature_rsa(const uint8_t* publicKey, uint32_t publicKeyLength,
                         const uint8_t* signature, uint32_t signatureLength,
                         const uint8_t* digest, uint32_t digestLength,
                         const Qor4SecureBootParams* params, void* context);
// `publicKey` is an uncompressed X9.63 point; `signature` a DER ECDSA-Sig-Value.
int verify_signature_ecdsa(const uint8_t* publicKey, uint32_t publicKeyLength,
                           const uint8_t* signature, uint32_t signatureLength,
                           const uint8_t* digest, uint32_t digestLength,
                           const Qor4SecureBootParams* params, void* context);

// The SHA-1 chain then the RSA signature, both with kQor4DecodeSecureBootRsa1kSha1.
int qor4_verify_signature_with_chain(const uint8_t* chain, uint32_t chainLength,
                                     const uint8_t* signature, uint32_t signatureLength,
                                     const uint8_t* digest, uint32_t digestLength,
                                     const uint8_t** certificateProperties,
                                     uint32_t* certificatePropertiesLength);

}  // namespace brisvale
