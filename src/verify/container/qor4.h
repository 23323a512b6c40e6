// The signed container ("QOR4"): decoding of its payload, manifest and restore-info
// sections into a context that points into the caller's buffer, lookup of properties by
// four-character code, cached digests, and the trust evaluation that checks the
// manifest's chain and signature through a parameter set of functions and then hands
// every manifest and object property to a callback. Nothing here allocates or copies.
//
// Results are DERResult codes, -1 where noted, or whatever a slot or callback returned.
// Tag arguments are a tag number plus the high 32 bits of the DERTag; for property and
// object codes the private-constructed bits are added here, so callers pass 0.
#pragma once

#include <cstdint>
#include <optional>

#include "platform/crypto.h"
#include "verify/der/der.h"

namespace brisvale {

inline constexpr uint32_t kQor4MaxDigestLength = 48;

constexpr uint32_t Qor4Code(const char (&code)[5]) {
  return (uint32_t{static_cast<uint8_t>(code[0])} << 24) |
         (uint32_t{static_cast<uint8_t>(code[1])} << 16) |
         (uint32_t{static_cast<uint8_t>(code[2])} << 8) | uint32_t{static_cast<uint8_t>(code[3])};
}

inline constexpr uint32_t kQor4MagicContainer = Qor4Code("QOR4");
inline constexpr uint32_t kQor4MagicPayload = Qor4Code("QO4P");
inline constexpr uint32_t kQor4MagicManifest = Qor4Code("QO4M");
inline constexpr uint32_t kQor4MagicRestoreInfo = Qor4Code("QO4R");
inline constexpr uint32_t kQor4ManifestBody = Qor4Code("MANB");
inline constexpr uint32_t kQor4ManifestProperties = Qor4Code("MANP");
inline constexpr uint32_t kQor4ObjectProperties = Qor4Code("OBJP");

// The high 32 bits of a private, constructed DERTag.
inline constexpr uint32_t kQor4PrivateConstructedHigh = 0xE0000000;

// --- Section records: destinations of the container tables, rows in table order ---------

struct DERQor4 {
  DERItem magic;
  DERItem payload;      // whole encoding
  DERItem manifest;     // content of [0]: the manifest's encoding
  DERItem restoreInfo;  // content of [1]
};

struct DERQor4Payload {
  DERItem magic;
  DERItem type;
  DERItem version;
  DERItem data;
  DERItem keybag;
  DERItem compression;
};

struct DERQor4Compression {
  DERItem algorithm;
  DERItem uncompressedSize;
};

struct DERQor4Manifest {
  DERItem magic;
  DERItem version;
  DERItem body;  // whole SET encoding: the signed bytes
  DERItem signature;
  DERItem certificateChain;
};

struct DERQor4RestoreInfo {
  DERItem magic;
  DERItem properties;
};

extern const DERItemSpec DERQor4ItemSpecs[];
extern const uint32_t DERNumQor4ItemSpecs;
extern const DERItemSpec DERQor4PayloadItemSpecs[];
extern const uint32_t DERNumQor4PayloadItemSpecs;
extern const DERItemSpec DERQor4CompressionItemSpecs[];
extern const uint32_t DERNumQor4CompressionItemSpecs;
extern const DERItemSpec DERQor4ManifestItemSpecs[];
extern const uint32_t DERNumQor4ManifestItemSpecs;
extern const DERItemSpec DERQor4RestoreInfoItemSpecs[];
extern const uint32_t DERNumQor4RestoreInfoItemSpecs;

// --- Context and callback records ---------------------------------------------------------

// Owned by the caller and zeroed before use; points into the caller's buffer.
struct Qor4DecodeContext {
  uint8_t payloadHashValid;
  uint8_t manifestHashValid;
  DERItem payloadEncoding;
  DERItem manifestEncoding;
  DERItem manifestBodyDictionary;  // content of the "MANB" SET
  DERItem manifestProperties;      // content of the "MANP" SET
  DERItem objectProperties;        // content of the evaluated object's SET
  DERQor4Payload payload;
  uint8_t payloadHash[kQor4MaxDigestLength];
  DERQor4Manifest manifest;
  DERItem certificateProperties;  // leaf's manifest-constraint extension value (a SET)
  uint8_t manifestHash[kQor4MaxDigestLength];
  uint8_t manifestBodyDigest[kQor4MaxDigestLength];
  DERQor4RestoreInfo restoreInfo;
};

struct Qor4Property {
  DERItem name;
  DERTag tag;
  DERItem value;
  DERTag valueTag;
};

struct Qor4PropertyRef {
  DERItem encoding;  // the property element's content: SEQUENCE { name, value } with header
  DERTag valueTag;
};

enum Qor4DictionaryKind : uint32_t {
  kQor4DictionaryManifest = 0,
  kQor4DictionaryObject = 1,
};

// Returns 0 to go on; anything else stops the evaluation with that value.
using Qor4PropertyCallback = int (*)(uint32_t tagNumber, Qor4PropertyRef property,
                                     uint32_t dictionaryKind, void* context);
// A previously accepted manifest digest, or null.
using Qor4StoredManifestHashFunction = const uint8_t* (*)(const Qor4DecodeContext* decodeContext,
                                                           void* context);

struct Qor4PropertyCallbacks {
  Qor4PropertyCallback propertyCallback;               // required
  Qor4StoredManifestHashFunction storedManifestHash;  // optional
};

struct Qor4SecureBootParams;

struct Qor4DigestInfo {
  uint32_t digestLength;
  const DERItem* digestOid;
  // Unset means this set cannot compute digests.
  std::optional<crypto::DigestAlgorithm> algorithm;
};

using Qor4ComputeDigestFunction = int (*)(const uint8_t* data, uint32_t length, uint8_t* output,
                                          uint32_t outputLength,
                                          const Qor4SecureBootParams* params);
using Qor4VerifyChainFunction = int (*)(const uint8_t* chain, uint32_t chainLength,
                                        const uint8_t** publicKey, uint32_t* publicKeyLength,
                                        const uint8_t** certificateProperties,
                                        uint32_t* certificatePropertiesLength,
                                        const Qor4SecureBootParams* params, void* context);
using Qor4VerifySignatureFunction = int (*)(const uint8_t* publicKey, uint32_t publicKeyLength,
                                            const uint8_t* signature, uint32_t signatureLength,
                                            const uint8_t* digest, uint32_t digestLength,
                                            const Qor4SecureBootParams* params, void* context);
using Qor4EvaluateCertificatePropertiesFunction = int (*)(Qor4DecodeContext* decodeContext,
                                                          void* context);

struct Qor4SecureBootParams {
  Qor4ComputeDigestFunction computeDigest;
  Qor4VerifyChainFunction verifyChain;
  Qor4VerifySignatureFunction verifySignature;
  Qor4EvaluateCertificatePropertiesFunction evaluateCertificateProperties;
  const Qor4DigestInfo* digestInfo;
  const DERItem* signatureAlgorithm;
  const DERItem* keyAlgorithm;
};

// Functions of the fixed 20-byte entry point.
using Qor4HashFunction = void (*)(const uint8_t* data, uint32_t length, uint8_t* output);
using Qor4SignatureWithChainFunction = int (*)(const uint8_t* chain, uint32_t chainLength,
                                               const uint8_t* signature, uint32_t signatureLength,
                                               const uint8_t* digest, uint32_t digestLength,
                                               const uint8_t** certificateProperties,
                                               uint32_t* certificatePropertiesLength);

// --- Decoding and layout ---------------------------------------------------------------------

// Clears the context and decodes a whole container; the buffer must end where it ends.
int Qor4DecodeInit(const uint8_t* bytes, uint32_t length, Qor4DecodeContext* context);
// Clears the context and decodes a bare payload SEQUENCE.
int Qor4DecodeInitPayload(const uint8_t* bytes, uint32_t length, Qor4DecodeContext* context);
// Decodes a bare manifest SEQUENCE into the manifest rows without clearing the context.
// A buffer longer than the element gives DERResultOverflow with the encoding recorded.
int Qor4DecodeInitManifest(const uint8_t* bytes, uint32_t length, Qor4DecodeContext* context);

// From a prefix of a container, its total encoded size. -1 for null arguments.
int Qor4DecodeParseLengthFromBufferWithTag(const uint8_t* bytes, uint32_t availableLength,
                                           uint32_t magic, uint32_t* totalLength);
int Qor4DecodeParseLengthFromBuffer(const uint8_t* bytes, uint32_t availableLength,
                                    uint32_t* totalLength);

int DERQor4Decode(const DERItem* item, DERQor4* destination);
int DERQor4DecodePayload(const DERItem* item, DERQor4Payload* destination);
int DERQor4DecodeManifest(const DERItem* item, DERQor4Manifest* destination);
int DERQor4DecodeRestoreInfo(const DERItem* item, DERQor4RestoreInfo* destination);

// Compares IA5String content with a four-character code: -1 when shorter than 4 bytes,
// 1 when longer, -2 when not a valid non-negative INTEGER content, else -1, 0 or 1 by
// numeric order.
int DERQor4DecodeTagCompare(const DERItem* content, uint32_t code);

// --- Property search -------------------------------------------------------------------------

int DERQor4DecodeFindInSequence(const uint8_t* next, const uint8_t* end, uint32_t tagNumber,
                                uint32_t tagHigh, DERItem* content);
int DERQor4DecodeContentFindItemWithTag(const DERItem* dictionary, uint32_t tagNumber,
                                        uint32_t tagHigh, DERItem* content);
// Decodes SEQUENCE { IA5String name, value }; fills name, value and valueTag.
int DERQor4DecodeProperty(const DERItem* encoding, uint32_t tagNumber, uint32_t tagHigh,
                          Qor4Property* property);
int DERQor4DecodeFindProperty(const DERItem* dictionary, uint32_t tagNumber, uint32_t tagHigh,
                              uint32_t valueTagNumber, uint32_t valueTagHigh,
                              Qor4Property* property);
// Either output may be null, not both. -1 when the body is not a constructed SET.
int DERQor4DecodeParseManifestProperties(const Qor4DecodeContext* context,
                                         DERItem* manifestBodyDictionary,
                                         DERItem* manifestProperties);

// --- Getters -------------------------------------------------------------------------------------

bool Qor4DecodePayloadExists(const Qor4DecodeContext* context);
int Qor4DecodeGetPayload(const Qor4DecodeContext* context, DERItem* data);
int Qor4DecodeGetPayloadType(const Qor4DecodeContext* context, uint32_t* type);
int Qor4DecodeGetPayloadVersion(const Qor4DecodeContext* context, DERItem* version);
bool Qor4DecodePayloadKeybagExists(const Qor4DecodeContext* context);
int Qor4DecodeGetPayloadKeybag(const Qor4DecodeContext* context, DERItem* keybag);
bool Qor4DecodePayloadCompressionInfoExists(const Qor4DecodeContext* context);
// On failure, when both outputs were given, both are set to 0xFFFFFFFF.
int Qor4DecodeGetPayloadCompressionInfo(const Qor4DecodeContext* context, uint32_t* algorithm,
                                        uint32_t* uncompressedSize);
bool Qor4DecodeManifestExists(const Qor4DecodeContext* context);
// Writes the outputs even when absent; -1 when either is zero.
int Qor4DecodeGetManifest(const Qor4DecodeContext* context, const uint8_t** data,
                          uint32_t* length);

// Sections: 0 is the manifest, 1 the restore info.
int Qor4DecodeSectionExists(const Qor4DecodeContext* context, uint32_t section, bool* exists);
bool Qor4DecodeRestoreInfoExists(const Qor4DecodeContext* context);
int Qor4DecodeGetPropertyFromSection(const Qor4DecodeContext* context, uint32_t section,
                                     uint32_t tagNumber, uint32_t tagHigh,
                                     uint32_t valueTagNumber, uint32_t valueTagHigh,
                                     Qor4Property* property);
int Qor4DecodeGetBooleanFromSection(const Qor4DecodeContext* context, uint32_t section,
                                    uint32_t tagNumber, uint32_t tagHigh, bool* value);
int Qor4DecodeGetIntegerFromSection(const Qor4DecodeContext* context, uint32_t section,
                                    uint32_t tagNumber, uint32_t tagHigh, uint32_t* value);
int Qor4DecodeGetInteger64FromSection(const Qor4DecodeContext* context, uint32_t section,
                                      uint32_t tagNumber, uint32_t tagHigh, uint64_t* value);
int Qor4DecodeGetDataFromSection(const Qor4DecodeContext* context, uint32_t section,
                                 uint32_t tagNumber, uint32_t tagHigh, DERItem* value);
int Qor4DecodeGetRestoreInfoBoolean(const Qor4DecodeContext* context, uint32_t tagNumber,
                                    uint32_t tagHigh, bool* value);
int Qor4DecodeGetRestoreInfoInteger(const Qor4DecodeContext* context, uint32_t tagNumber,
                                    uint32_t tagHigh, uint32_t* value);
int Qor4DecodeGetRestoreInfoInteger64(const Qor4DecodeContext* context, uint32_t tagNumber,
                                      uint32_t tagHigh, uint64_t* value);
int Qor4DecodeGetRestoreInfoData(const Qor4DecodeContext* context, uint32_t tagNumber,
                                 uint32_t tagHigh, DERItem* value);

int Qor4DecodeGetObjectProperty(const Qor4DecodeContext* context, uint32_t objectTagNumber,
                                uint32_t objectTagHigh, uint32_t propertyTagNumber,
                                uint32_t propertyTagHigh, uint32_t valueTagNumber,
                                uint32_t valueTagHigh, Qor4Property* property);
int Qor4DecodeGetObjectPropertyBoolean(const Qor4DecodeContext* context, uint32_t objectTagNumber,
                                       uint32_t objectTagHigh, uint32_t propertyTagNumber,
                                       uint32_t propertyTagHigh, bool* value);
int Qor4DecodeGetObjectPropertyInteger(const Qor4DecodeContext* context, uint32_t objectTagNumber,
                                       uint32_t objectTagHigh, uint32_t propertyTagNumber,
                                       uint32_t propertyTagHigh, uint32_t* value);
int Qor4DecodeGetObjectPropertyInteger64(const Qor4DecodeContext* context,
                                         uint32_t objectTagNumber, uint32_t objectTagHigh,
                                         uint32_t propertyTagNumber, uint32_t propertyTagHigh,
                                         uint64_t* value);
int Qor4DecodeGetObjectPropertyData(const Qor4DecodeContext* context, uint32_t objectTagNumber,
                                    uint32_t objectTagHigh, uint32_t propertyTagNumber,
                                    uint32_t propertyTagHigh, const uint8_t** data,
                                    uint32_t* length);
int Qor4DecodeGetObjectPropertyString(const Qor4DecodeContext* context, uint32_t objectTagNumber,
                                      uint32_t objectTagHigh, uint32_t propertyTagNumber,
                                      uint32_t propertyTagHigh, const uint8_t** data,
                                      uint32_t* length);

// Values of one property as the callback receives it (Qor4PropertyRef::encoding).
int Qor4DecodeGetPropertyBoolean(const DERItem* encoding, uint32_t tagNumber, uint32_t tagHigh,
                                 bool* value);
int Qor4DecodeGetPropertyInteger(const DERItem* encoding, uint32_t tagNumber, uint32_t tagHigh,
                                 uint32_t* value);
int Qor4DecodeGetPropertyInteger64(const DERItem* encoding, uint32_t tagNumber,
                                   uint32_t tagHigh, uint64_t* value);
int Qor4DecodeGetPropertyData(const DERItem* encoding, uint32_t tagNumber, uint32_t tagHigh,
                              const uint8_t** data, uint32_t* length);

// --- Digests -------------------------------------------------------------------------------------

// SHA-1 (20 bytes) of the payload / manifest encoding, from the cache when it is valid.
int Qor4DecodeCopyPayloadHash(Qor4DecodeContext* context, uint8_t* output, uint32_t outputSize);
int Qor4DecodeCopyPayloadHashWithCallback(Qor4DecodeContext* context, Qor4HashFunction hash,
                                          uint8_t* output, uint32_t outputSize);
int Qor4DecodeCopyPayloadDigest(Qor4DecodeContext* context, uint8_t* output,
                                uint32_t outputLength, const Qor4SecureBootParams* params);
int Qor4DecodeCopyManifestHash(Qor4DecodeContext* context, uint8_t* output, uint32_t outputSize);
int Qor4DecodeCopyManifestHashWithCallback(Qor4DecodeContext* context, Qor4HashFunction hash,
                                           uint8_t* output, uint32_t outputSize);
int Qor4DecodeCopyManifestDigest(Qor4DecodeContext* context, uint8_t* output,
                                 uint32_t outputLength, const Qor4SecureBootParams* params);

// --- Trust evaluation ----------------------------------------------------------------------------

int Qor4DecodePerformTrustEvaluatationWithCallbacks(uint32_t objectCode,
                                                    Qor4DecodeContext* context,
                                                    const Qor4PropertyCallbacks* callbacks,
                                                    const Qor4SecureBootParams* params,
                                                    void* callbackContext);
int Qor4DecodePerformTrustEvaluatation(uint32_t objectCode, Qor4DecodeContext* context,
                                       Qor4PropertyCallback propertyCallback,
                                       const Qor4SecureBootParams* params,
                                       void* callbackContext);
// The fixed 20-byte form: one function checks the chain and the signature together.
int Qor4DecodeEvaluateTrustWithCallbacks(uint32_t objectCode, Qor4DecodeContext* context,
                                         Qor4PropertyCallback propertyCallback,
                                         Qor4SignatureWithChainFunction signatureWithChain,
                                         Qor4EvaluateCertificatePropertiesFunction
                                             evaluateCertificateProperties,
                                         Qor4HashFunction hash, void* callbackContext);
// Qor4DecodeEvaluateTrustWithCallbacks bound to the SHA-1 RSA chain functions. It lives
// with the certificate-chain verifiers, which it needs.
int Qor4DecodeEvaluateTrust(uint32_t objectCode, Qor4DecodeContext* context,
                            Qor4PropertyCallback propertyCallback, void* callbackContext);

int Qor4DecodeEvaluateManifestProperties(const Qor4DecodeContext* context,
                                         Qor4PropertyCallback propertyCallback,
                                         void* callbackContext);
int Qor4DecodeEvaluateObjectProperties(const Qor4DecodeContext* context,
                                       Qor4PropertyCallback propertyCallback,
                                       void* callbackContext);
int Qor4DecodeEvaluateDictionaryProperties(const DERItem* dictionary, uint32_t dictionaryKind,
                                           Qor4PropertyCallback propertyCallback,
                                           void* callbackContext);
// Checks the leaf certificate's constraints ("MANP" / "OBJP" groups) against the
// evaluated manifest and object properties.
int Qor4DecodeEvaluateCertificateProperties(Qor4DecodeContext* context, void* callbackContext);

}  // namespace brisvale
