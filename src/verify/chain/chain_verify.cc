// Certificate chains of the signed container: split the manifest's chain, parse each
// certificate in place, check issuer names and signatures up from the compiled-in root
// and, for the SHA-1 chain, the intermediate's common name. Validity dates, key usage,
// basic constraints and the root's own signature are deliberately not checked.
#include <cstring>

#include "verify/chain/compiled_roots.h"
#include "verify/chain/secure_boot.h"

namespace brisvale {
namespace {

enum class KeyKind { Rsa, Ec };

// At most a root and two chain certificates.
constexpr uint32_t kMaxCertificates = 3;

// Splits `chain` into exactly `expected` whole elements after the root in `certificates`.
int SplitChain(const uint8_t* chain, uint32_t chainLength, bool limitSize, uint32_t expected,
               DERItem* certificates) {
  DERItem remaining{chain, chainLength};
  uint32_t count = 0;
  while (remaining.length > 0) {
    DERDecodedItem element;
    if (DERDecodeItem(&remaining, &element) != DERResultSuccess) return -1;
    uint64_t header = static_cast<uint64_t>(element.content.data - remaining.data);
    uint64_t total = header + element.content.length;
    if (total > remaining.length) return -1;
    if (limitSize && total >= kMaxRsaChainCertificateSize) return -1;
    if (count == expected) return -1;
    certificates[count++] = DERItem{remaining.data, static_cast<uint32_t>(total)};
    remaining.data += total;
    remaining.length -= static_cast<uint32_t>(total);
  }
  return count == expected ? 0 : -1;
}

bool IsNullParameters(const DERItem& parameters) {
  return parameters.length == 2 && parameters.data[0] == 0x05 && parameters.data[1] == 0x00;
}

// The element whose content is `content`, from the end of the element before it: the
// table parse stores contents, while names are compared with their headers.
DERItem WholeEncoding(const DERItem& previous, const DERItem& content) {
  const uint8_t* start = previous.data + previous.length;
  return DERItem{start, static_cast<uint32_t>(content.data + content.length - start)};
}

int ParseCertificate(const DERItem& certificate, KeyKind kind, Qor4ParsedCertificate* parsed) {
  std::memset(parsed, 0, sizeof(*parsed));
  if (DERParseSequence(&certificate, DERNumSignedCertCrlItemSpecs, DERSignedCertCrlItemSpecs,
                       &parsed->signedCert, sizeof(parsed->signedCert)) != DERResultSuccess ||
      DERParseSequence(&parsed->signedCert.tbs, DERNumTBSCertItemSpecs, DERTBSCertItemSpecs,
                       &parsed->tbs, sizeof(parsed->tbs)) != DERResultSuccess) {
    return -1;
  }
  DERSubjPubKeyInfo keyInfo;
  DERAlgorithmId algorithm;
  if (DERParseSequenceContent(&parsed->tbs.subjectPubKey, DERNumSubjPubKeyInfoItemSpecs,
                              DERSubjPubKeyInfoItemSpecs, &keyInfo,
                              sizeof(keyInfo)) != DERResultSuccess ||
      DERParseSequenceContent(&keyInfo.algId, DERNumAlgorithmIdItemSpecs,
                              DERAlgorithmIdItemSpecs, &algorithm,
                              sizeof(algorithm)) != DERResultSuccess) {
    return -1;
  }
  if (kind == KeyKind::Rsa) {
    if (!DEROidCompare(&algorithm.oid, &oidRsa)) return -1;
    if (algorithm.params.length != 0 && !IsNullParameters(algorithm.params)) return -1;
  } else {
    if (!DEROidCompare(&algorithm.oid, &oidEcPubKey)) return -1;
    DERDecodedItem curve;
    if (DERDecodeItem(&algorithm.params, &curve) != DERResultSuccess ||
        curve.content.data + curve.content.length != algorithm.params.data + algorithm.params.length) {
      return -1;
    }
    parsed->keyParameters = algorithm.params;
  }
  uint8_t unusedBits = 0;
  if (DERParseBitString(&keyInfo.pubKey, &parsed->publicKey, &unusedBits) != DERResultSuccess ||
      unusedBits != 0) {
    return -1;
  }
  return find_manifest_constraints(&parsed->tbs, &parsed->constraints);
}

int ParseAll(const DERItem* certificates, uint32_t count, KeyKind kind,
             Qor4ParsedCertificate* parsed) {
  for (uint32_t i = 0; i < count; ++i) {
    if (ParseCertificate(certificates[i], kind, &parsed[i]) != 0) return -1;
  }
  return 0;
}

// Each certificate after the first names its predecessor as issuer and carries its
// signature.
int VerifyLinks(const Qor4ParsedCertificate* parsed, uint32_t count,
                const Qor4SecureBootParams* params) {
  for (uint32_t i = 1; i < count; ++i) {
    DERItem issuer = WholeEncoding(parsed[i].tbs.tbsSigAlg, parsed[i].tbs.issuer);
    DERItem issuerSubject = WholeEncoding(parsed[i - 1].tbs.validity, parsed[i - 1].tbs.subject);
    if (!DEROidCompare(&issuer, &issuerSubject)) return -1;
    if (verify_certificate_signature(&parsed[i - 1].publicKey, &parsed[i], params) != 0) {
      return -1;
    }
  }
  return 0;
}

// The first common name of a subject, with its header.
int FindCommonName(const DERItem& subject, DERItem* commonName) {
  DERSequence names;
  DERDecodeSeqContentInit(&subject, &names);
  DERDecodedItem name;
  DERResult result;
  while ((result = DERDecodeSeqNext(&names, &name)) == DERResultSuccess) {
    if (name.tag != DERTagSet) return -1;
    DERSequence attributes;
    DERDecodeSeqContentInit(&name.content, &attributes);
    DERDecodedItem attribute;
    while ((result = DERDecodeSeqNext(&attributes, &attribute)) == DERResultSuccess) {
      if (attribute.tag != DERTagSequence) return -1;
      DERAttributeTypeAndValue typeAndValue;
      if (DERParseSequenceContent(&attribute.content, DERNumAttributeTypeAndValueItemSpecs,
                                  DERAttributeTypeAndValueItemSpecs, &typeAndValue,
                                  sizeof(typeAndValue)) != DERResultSuccess) {
        return -1;
      }
      if (DEROidCompare(&typeAndValue.type, &oidCommonName)) {
        *commonName = typeAndValue.value;
        return 0;
      }
    }
    if (result != DERResultEndOfSequence) return -1;
  }
  return -1;
}

void WriteOutputs(const Qor4ParsedCertificate& leaf, const uint8_t** publicKey,
                  uint32_t* publicKeyLength, const uint8_t** certificateProperties,
                  uint32_t* certificatePropertiesLength) {
  *publicKey = leaf.publicKey.data;
  *publicKeyLength = leaf.publicKey.length;
  if (leaf.constraints.data && certificateProperties && certificatePropertiesLength) {
    *certificateProperties = leaf.constraints.data;
    *certificatePropertiesLength = leaf.constraints.length;
  }
}

// A chain of `count` certificates under `root`, with `kind` keys.
int VerifyChain(const uint8_t* root, uint32_t rootSize, uint32_t count, KeyKind kind,
                bool checkIntermediateName, const uint8_t* chain, uint32_t chainLength,
                const uint8_t** publicKey, uint32_t* publicKeyLength,
                const uint8_t** certificateProperties, uint32_t* certificatePropertiesLength,
                const Qor4SecureBootParams* params) {
  if (!chain || !publicKey || !publicKeyLength || !params) return -1;
  DERItem certificates[kMaxCertificates];
  certificates[0] = DERItem{root, rootSize};
  if (SplitChain(chain, chainLength, kind == KeyKind::Rsa, count, certificates + 1) != 0) {
    return -1;
  }
  Qor4ParsedCertificate parsed[kMaxCertificates];
  if (ParseAll(certificates, count + 1, kind, parsed) != 0 ||
      VerifyLinks(parsed, count + 1, params) != 0) {
    return -1;
  }
  if (checkIntermediateName) {
    DERItem commonName;
    const DERItem expected{kExpectedIntermediateCommonName, kExpectedIntermediateNameSize};
    if (FindCommonName(parsed[1].tbs.subject, &commonName) != 0 ||
        !DEROidCompare(&commonName, &expected)) {
      return -1;
    }
  }
  WriteOutputs(parsed[count], publicKey, publicKeyLength, certificateProperties,
               certificatePropertiesLength);
  return 0;
}

}  // namespace

int find_manifest_constraints(const DERTBSCert* tbs, DERItem* constraints) {
  if (!tbs || !constraints) return -1;
  if (!tbs->extensions.data) return 0;
  DERTag tag;
  DERSequence extensions;
  if (DERDecodeSeqInit(&tbs->extensions, &tag, &extensions) != DERResultSuccess ||
      tag != DERTagSequence) {
    return -1;
  }
  DERDecodedItem element;
  while (DERDecodeSeqNext(&extensions, &element) == DERResultSuccess) {
    if (element.tag != DERTagSequence) return -1;
    DERExtension extension;
    if (DERParseSequenceContent(&element.content, DERNumExtensionItemSpecs, DERExtensionItemSpecs,
                                &extension, sizeof(extension)) != DERResultSuccess) {
      return -1;
    }
    if (!DEROidCompare(&extension.extnID, &oidVantrelQor4ManifestCertSpec)) continue;
    DERDecodedItem set;
    if (DERDecodeItem(&extension.extnValue, &set) != DERResultSuccess || set.tag != DERTagSet) {
      return -1;
    }
    *constraints = extension.extnValue;
  }
  return 0;
}

int parse_certificates(const DERItem* certificates, uint32_t count,
                       Qor4ParsedCertificate* parsed) {
  if (!certificates || !parsed) return -1;
  return ParseAll(certificates, count, KeyKind::Rsa, parsed);
}

int verify_certificate_signature(const DERItem* issuerKey, const Qor4ParsedCertificate* subject,
                                 const Qor4SecureBootParams* params) {
  if (!issuerKey || !subject || !params || !params->computeDigest || !params->verifySignature ||
      !params->signatureAlgorithm || !params->digestInfo || !params->digestInfo->algorithm ||
      params->digestInfo->digestLength > kQor4MaxDigestLength) {
    return -1;
  }
  DERAlgorithmId algorithm;
  if (DERParseSequenceContent(&subject->signedCert.sigAlg, DERNumAlgorithmIdItemSpecs,
                              DERAlgorithmIdItemSpecs, &algorithm,
                              sizeof(algorithm)) != DERResultSuccess) {
    return -1;
  }
  if (algorithm.params.length != 0 && !DEROidCompare(&algorithm.oid, &oidEcPubKey) &&
      !IsNullParameters(algorithm.params)) {
    return -1;
  }
  if (!DEROidCompare(&algorithm.oid, params->signatureAlgorithm)) return -1;
  uint8_t digest[kQor4MaxDigestLength];
  uint32_t digestLength = params->digestInfo->digestLength;
  const DERItem& tbs = subject->signedCert.tbs;
  if (params->computeDigest(tbs.data, tbs.length, digest, digestLength, params) != 0) return -1;
  DERItem signature;
  uint8_t unusedBits = 0;
  if (DERParseBitString(&subject->signedCert.sig, &signature, &unusedBits) != DERResultSuccess ||
      unusedBits != 0) {
    return -1;
  }
  return params->verifySignature(issuerKey->data, issuerKey->length, signature.data,
                                 signature.length, digest, digestLength, params, nullptr) == 0
             ? 0
             : -1;
}

int verify_chain_qor4_v1(const uint8_t* chain, uint32_t chainLength, const uint8_t** publicKey,
                         uint32_t* publicKeyLength, const uint8_t** certificateProperties,
                         uint32_t* certificatePropertiesLength,
                         const Qor4SecureBootParams* params, void*) {
  return VerifyChain(ROOT_CA_CERTIFICATE, ROOT_CA_CERTIFICATE_SIZE, 2, KeyKind::Rsa, true, chain,
                     chainLength, publicKey, publicKeyLength, certificateProperties,
                     certificatePropertiesLength, params);
}

int verify_chain_qor4_v2(const uint8_t* chain, uint32_t chainLength, const uint8_t** publicKey,
                         uint32_t* publicKeyLength, const uint8_t** certificateProperties,
                         uint32_t* certificatePropertiesLength,
                         const Qor4SecureBootParams* params, void*) {
  return VerifyChain(RSA4K_SHA384_ROOT_CA_CERTIFICATE, RSA4K_SHA384_ROOT_CA_CERTIFICATE_SIZE, 1,
                     KeyKind::Rsa, false, chain, chainLength, publicKey, publicKeyLength,
                     certificateProperties, certificatePropertiesLength, params);
}

int verify_chain_qor4_ecdsa256(const uint8_t* chain, uint32_t chainLength,
                               const uint8_t** publicKey, uint32_t* publicKeyLength,
                               const uint8_t** certificateProperties,
                               uint32_t* certificatePropertiesLength,
                               const Qor4SecureBootParams* params, void*) {
  return VerifyChain(LOCAL_EC256_SHA256_ROOT_CA_CERTIFICATE,
                     LOCAL_EC256_SHA256_ROOT_CA_CERTIFICATE_SIZE, 1, KeyKind::Ec, false, chain,
                     chainLength, publicKey, publicKeyLength, certificateProperties,
                     certificatePropertiesLength, params);
}

}  // namespace brisvale
