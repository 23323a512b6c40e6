// The X.509, CRL and RSA key tables. Offsets come from the records so they match this
// build's layout; row order, tags and options are what the parsers rely on.
#include "verify/der/der_item_specs.h"

#include <cstddef>
#include <iterator>

namespace brisvale {

namespace {

constexpr uint16_t kOpt = DERItemOptional;
constexpr uint16_t kAny = DERItemAnyTag;
constexpr uint16_t kSave = DERItemSaveEncoding;
constexpr uint16_t kSkip = DERItemSkip;
constexpr uint16_t kRsa = DERItemRsaKeyMarker;

}  // namespace

#define AT(record, field) static_cast<uint32_t>(offsetof(record, field))
#define COUNT(name) const uint32_t DERNum##name##ItemSpecs = std::size(DER##name##ItemSpecs)

const DERItemSpec DERSignedCertCrlItemSpecs[] = {
    {AT(DERSignedCertCrl, tbs), DERTagSequence, kSave},
    {AT(DERSignedCertCrl, sigAlg), DERTagSequence, 0},
    {AT(DERSignedCertCrl, sig), DERTagBitString, 0},
};
COUNT(SignedCertCrl);

const DERItemSpec DERTBSCertItemSpecs[] = {
    {AT(DERTBSCert, version), DERTagContextSpecificConstructed(0), kOpt},
    {AT(DERTBSCert, serialNum), DERTagInteger, 0},
    {AT(DERTBSCert, tbsSigAlg), DERTagSequence, 0},
    {AT(DERTBSCert, issuer), DERTagSequence, 0},
    {AT(DERTBSCert, validity), DERTagSequence, 0},
    {AT(DERTBSCert, subject), DERTagSequence, 0},
    {AT(DERTBSCert, subjectPubKey), DERTagSequence, 0},
    {AT(DERTBSCert, issuerID), DERTagContextSpecific(1), kOpt},
    {AT(DERTBSCert, subjectID), DERTagContextSpecific(2), kOpt},
    {AT(DERTBSCert, extensions), DERTagContextSpecificConstructed(3), kOpt},
};
COUNT(TBSCert);

const DERItemSpec DERAlgorithmIdItemSpecs[] = {
    {AT(DERAlgorithmId, oid), DERTagOid, 0},
    {AT(DERAlgorithmId, params), 0, kAny | kOpt | kSave},
};
COUNT(AlgorithmId);

const DERItemSpec DERSubjPubKeyInfoItemSpecs[] = {
    {AT(DERSubjPubKeyInfo, algId), DERTagSequence, 0},
    {AT(DERSubjPubKeyInfo, pubKey), DERTagBitString, 0},
};
COUNT(SubjPubKeyInfo);

const DERItemSpec DERAttributeTypeAndValueItemSpecs[] = {
    {AT(DERAttributeTypeAndValue, type), DERTagOid, 0},
    {AT(DERAttributeTypeAndValue, value), 0, kAny | kSave},
};
COUNT(AttributeTypeAndValue);

const DERItemSpec DERExtensionItemSpecs[] = {
    {AT(DERExtension, extnID), DERTagOid, 0},
    {AT(DERExtension, critical), DERTagBoolean, kOpt},
    {AT(DERExtension, extnValue), DERTagOctetString, 0},
};
COUNT(Extension);

const DERItemSpec DERRSAPubKeyPKCS1ItemSpecs[] = {
    {AT(DERRSAPubKeyPKCS1, modulus), DERTagInteger, 0},
    {AT(DERRSAPubKeyPKCS1, pubExponent), DERTagInteger, 0},
};
COUNT(RSAPubKeyPKCS1);

const DERItemSpec DERValidityItemSpecs[] = {
    {AT(DERValidity, notBefore), 0, kAny | kSave},
    {AT(DERValidity, notAfter), 0, kAny | kSave},
};
COUNT(Validity);

const DERItemSpec DERBasicConstraintsItemSpecs[] = {
    {AT(DERBasicConstraints, cA), DERTagBoolean, kOpt},
    {AT(DERBasicConstraints, pathLenConstraint), DERTagInteger, kOpt},
};
COUNT(BasicConstraints);

const DERItemSpec DERPrivateKeyUsagePeriodItemSpecs[] = {
    {AT(DERPrivateKeyUsagePeriod, notBefore), DERTagContextSpecific(0), kOpt},
    {AT(DERPrivateKeyUsagePeriod, notAfter), DERTagContextSpecific(1), kOpt},
};
COUNT(PrivateKeyUsagePeriod);

const DERItemSpec DERDistributionPointItemSpecs[] = {
    {AT(DERDistributionPoint, distributionPoint), DERTagContextSpecificConstructed(0), kOpt},
    {AT(DERDistributionPoint, reasons), DERTagContextSpecific(1), kOpt},
    {AT(DERDistributionPoint, cRLIssuer), DERTagContextSpecificConstructed(2), kOpt},
};
COUNT(DistributionPoint);

const DERItemSpec DERPolicyInformationItemSpecs[] = {
    {AT(DERPolicyInformation, policyIdentifier), DERTagOid, 0},
    {AT(DERPolicyInformation, policyQualifiers), DERTagSequence, kOpt},
};
COUNT(PolicyInformation);

const DERItemSpec DERPolicyQualifierInfoItemSpecs[] = {
    {AT(DERPolicyQualifierInfo, policyQualifierID), DERTagOid, 0},
    {AT(DERPolicyQualifierInfo, qualifier), 0, kAny | kSave},
};
COUNT(PolicyQualifierInfo);

const DERItemSpec DERUserNoticeItemSpecs[] = {
    {AT(DERUserNotice, noticeRef), DERTagSequence, kOpt},
    {AT(DERUserNotice, explicitText), 0, kAny | kOpt | kSave},
};
COUNT(UserNotice);

const DERItemSpec DERNoticeReferenceItemSpecs[] = {
    {AT(DERNoticeReference, organization), 0, kAny | kSave},
    {AT(DERNoticeReference, noticeNumbers), DERTagSequence, 0},
};
COUNT(NoticeReference);

const DERItemSpec DERPolicyMappingItemSpecs[] = {
    {AT(DERPolicyMapping, issuerDomainPolicy), DERTagOid, 0},
    {AT(DERPolicyMapping, subjectDomainPolicy), DERTagOid, 0},
};
COUNT(PolicyMapping);

const DERItemSpec DERAccessDescriptionItemSpecs[] = {
    {AT(DERAccessDescription, accessMethod), DERTagOid, 0},
    {AT(DERAccessDescription, accessLocation), 0, kAny | kSave},
};
COUNT(AccessDescription);

const DERItemSpec DERAuthorityKeyIdentifierItemSpecs[] = {
    {AT(DERAuthorityKeyIdentifier, keyIdentifier), DERTagContextSpecific(0), kOpt},
    {AT(DERAuthorityKeyIdentifier, authorityCertIssuer), DERTagContextSpecificConstructed(1), kOpt},
    {AT(DERAuthorityKeyIdentifier, authorityCertSerialNumber), DERTagContextSpecific(2), kOpt},
};
COUNT(AuthorityKeyIdentifier);

const DERItemSpec DEROtherNameItemSpecs[] = {
    {AT(DEROtherName, typeIdentifier), DERTagOid, 0},
    {AT(DEROtherName, value), DERTagContextSpecificConstructed(0), 0},
};
COUNT(OtherName);

const DERItemSpec DERPolicyConstraintsItemSpecs[] = {
    {AT(DERPolicyConstraints, requireExplicitPolicy), DERTagContextSpecific(0), kOpt},
    {AT(DERPolicyConstraints, inhibitPolicyMapping), DERTagContextSpecific(1), kOpt},
};
COUNT(PolicyConstraints);

const DERItemSpec DERTBSCrlItemSpecs[] = {
    {AT(DERTBSCrl, version), DERTagInteger, kOpt},
    {AT(DERTBSCrl, tbsSigAlg), DERTagSequence, 0},
    {AT(DERTBSCrl, issuer), DERTagSequence, 0},
    {AT(DERTBSCrl, thisUpdate), 0, kAny | kSave},
    {AT(DERTBSCrl, nextUpdate), 0, kAny | kSave},
    {AT(DERTBSCrl, revokedCerts), DERTagSequence, kOpt},
    {AT(DERTBSCrl, extensions), DERTagContextSpecificConstructed(0), kOpt},
};
COUNT(TBSCrl);

const DERItemSpec DERRevokedCertItemSpecs[] = {
    {AT(DERRevokedCert, serialNum), DERTagInteger, 0},
    {AT(DERRevokedCert, revocationDate), 0, kAny | kSave},
    {AT(DERRevokedCert, extensions), DERTagSequence, kOpt},
};
COUNT(RevokedCert);

const DERItemSpec DERRSAPrivKeyCRTItemSpecs[] = {
    {0, DERTagInteger, kSkip},
    {0, DERTagInteger, kSkip},
    {0, DERTagInteger, kSkip},
    {0, DERTagInteger, kSkip},
    {AT(DERRSAPrivKeyCRT, p), DERTagInteger, 0},
    {AT(DERRSAPrivKeyCRT, q), DERTagInteger, 0},
    {AT(DERRSAPrivKeyCRT, dp), DERTagInteger, 0},
    {AT(DERRSAPrivKeyCRT, dq), DERTagInteger, 0},
    {AT(DERRSAPrivKeyCRT, qInv), DERTagInteger, 0},
};
COUNT(RSAPrivKeyCRT);

const DERItemSpec DERRSAPubKeyVantrelItemSpecs[] = {
    {AT(DERRSAPubKeyVantrel, modulus), DERTagInteger, kRsa},
    {AT(DERRSAPubKeyVantrel, pubExponent), DERTagInteger, kRsa},
    {AT(DERRSAPubKeyVantrel, modulusParameter), DERTagInteger, kRsa},
};
COUNT(RSAPubKeyVantrel);

const DERItemSpec DERRSAKeyPairItemSpecs[] = {
    {AT(DERRSAKeyPair, version), DERTagInteger, kRsa},
    {AT(DERRSAKeyPair, n), DERTagInteger, kRsa},
    {AT(DERRSAKeyPair, e), DERTagInteger, kRsa},
    {AT(DERRSAKeyPair, d), DERTagInteger, kRsa},
    {AT(DERRSAKeyPair, p), DERTagInteger, kRsa},
    {AT(DERRSAKeyPair, q), DERTagInteger, kRsa},
    {AT(DERRSAKeyPair, dp), DERTagInteger, kRsa},
    {AT(DERRSAKeyPair, dq), DERTagInteger, kRsa},
    {AT(DERRSAKeyPair, qInv), DERTagInteger, kRsa},
};
COUNT(RSAKeyPair);

#undef AT
#undef COUNT

}  // namespace brisvale
