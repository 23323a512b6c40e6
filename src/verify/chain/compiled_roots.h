// Build-time trust data: the three root certificates the manifest chains lead to, the
// common name the general root's intermediate must carry, and the OID of the leaf's
// manifest-constraint extension. Development values come from tests/pki; a production
// build points BRISVALE_ROOTS_DIR at its own files.
#pragma once

#include <cstdint>

#include "verify/der/der.h"

namespace brisvale {

// The general root (RSA-2048, sha1WithRSAEncryption): anchor of the SHA-1 chain.
extern const uint8_t ROOT_CA_CERTIFICATE[];
extern const uint32_t ROOT_CA_CERTIFICATE_SIZE;
// The secure-boot root (RSA-4096, sha384WithRSAEncryption): anchor of the SHA-384 chain.
extern const uint8_t RSA4K_SHA384_ROOT_CA_CERTIFICATE[];
extern const uint32_t RSA4K_SHA384_ROOT_CA_CERTIFICATE_SIZE;
// The local test root (ECDSA P-256): anchor of the ECDSA chain.
extern const uint8_t LOCAL_EC256_SHA256_ROOT_CA_CERTIFICATE[];
extern const uint32_t LOCAL_EC256_SHA256_ROOT_CA_CERTIFICATE_SIZE;

// The intermediate's common name as a whole PrintableString element (tag, length 41,
// text).
inline constexpr uint32_t kExpectedIntermediateNameSize = 43;
extern const uint8_t kExpectedIntermediateCommonName[kExpectedIntermediateNameSize];

// Content octets of the manifest-constraint extension's OID.
extern const DERItem oidVantrelQor4ManifestCertSpec;

}  // namespace brisvale
