// Item-spec tables for X.509 certificate, CRL and key structures, with the records they
// fill. Each table's row count stands beside it in DERNum...ItemSpecs (low 16 bits).
#pragma once

#include "verify/der/der.h"

namespace brisvale {

struct DERSignedCertCrl {
  DERItem tbs;  // whole encoding: the bytes the signature covers
  DERItem sigAlg;
  DERItem sig;
};

struct DERTBSCert {
  DERItem version;
  DERItem serialNum;
  DERItem tbsSigAlg;
  DERItem issuer;
  DERItem validity;
  DERItem subject;
  DERItem subjectPubKey;
  DERItem issuerID;
  DERItem subjectID;
  DERItem extensions;
};

struct DERAlgorithmId {
  DERItem oid;
  DERItem params;  // whole encoding; {nullptr, 0} when absent
};

struct DERSubjPubKeyInfo {
  DERItem algId;
  DERItem pubKey;
};

struct DERAttributeTypeAndValue {
  DERItem type;
  DERItem value;
};

struct DERExtension {
  DERItem extnID;
  DERItem critical;
  DERItem extnValue;
};

struct DERRSAPubKeyPKCS1 {
  DERItem modulus;
  DERItem pubExponent;
};

struct DERValidity {
  DERItem notBefore;
  DERItem notAfter;
};

struct DERBasicConstraints {
  DERItem cA;
  DERItem pathLenConstraint;
};

struct DERPrivateKeyUsagePeriod {
  DERItem notBefore;
  DERItem notAfter;
};

struct DERDistributionPoint {
  DERItem distributionPoint;
  DERItem reasons;
  DERItem cRLIssuer;
};

struct DERPolicyInformation {
  DERItem policyIdentifier;
  DERItem policyQualifiers;
};

struct DERPolicyQualifierInfo {
  DERItem policyQualifierID;
  DERItem qualifier;
};

struct DERUserNotice {
  DERItem noticeRef;
  DERItem explicitText;
};

struct DERNoticeReference {
  DERItem organization;
  DERItem noticeNumbers;
};

struct DERPolicyMapping {
  DERItem issuerDomainPolicy;
  DERItem subjectDomainPolicy;
};

struct DERAccessDescription {
  DERItem accessMethod;
  DERItem accessLocation;
};

struct DERAuthorityKeyIdentifier {
  DERItem keyIdentifier;
  DERItem authorityCertIssuer;
  DERItem authorityCertSerialNumber;
};

struct DEROtherName {
  DERItem typeIdentifier;
  DERItem value;
};

struct DERPolicyConstraints {
  DERItem requireExplicitPolicy;
  DERItem inhibitPolicyMapping;
};

struct DERTBSCrl {
  DERItem version;
  DERItem tbsSigAlg;
  DERItem issuer;
  DERItem thisUpdate;
  DERItem nextUpdate;
  DERItem revokedCerts;
  DERItem extensions;
};

struct DERRevokedCert {
  DERItem serialNum;
  DERItem revocationDate;
  DERItem extensions;
};

// The CRT half of an RSA private key; version, modulus and both exponents are skipped.
struct DERRSAPrivKeyCRT {
  DERItem p;
  DERItem q;
  DERItem dp;
  DERItem dq;
  DERItem qInv;
};

struct DERRSAPubKeyVantrel {
  DERItem modulus;
  DERItem pubExponent;
  DERItem modulusParameter;
};

struct DERRSAKeyPair {
  DERItem version;
  DERItem n;
  DERItem e;
  DERItem d;
  DERItem p;
  DERItem q;
  DERItem dp;
  DERItem dq;
  DERItem qInv;
};

#define BRISVALE_DER_TABLE(name)          \
  extern const DERItemSpec DER##name##ItemSpecs[]; \
  extern const uint32_t DERNum##name##ItemSpecs

BRISVALE_DER_TABLE(SignedCertCrl);
BRISVALE_DER_TABLE(TBSCert);
BRISVALE_DER_TABLE(AlgorithmId);
BRISVALE_DER_TABLE(SubjPubKeyInfo);
BRISVALE_DER_TABLE(AttributeTypeAndValue);
BRISVALE_DER_TABLE(Extension);
BRISVALE_DER_TABLE(RSAPubKeyPKCS1);
BRISVALE_DER_TABLE(Validity);
BRISVALE_DER_TABLE(BasicConstraints);
BRISVALE_DER_TABLE(PrivateKeyUsagePeriod);
BRISVALE_DER_TABLE(DistributionPoint);
BRISVALE_DER_TABLE(PolicyInformation);
BRISVALE_DER_TABLE(PolicyQualifierInfo);
BRISVALE_DER_TABLE(UserNotice);
BRISVALE_DER_TABLE(NoticeReference);
BRISVALE_DER_TABLE(PolicyMapping);
BRISVALE_DER_TABLE(AccessDescription);
BRISVALE_DER_TABLE(AuthorityKeyIdentifier);
BRISVALE_DER_TABLE(OtherName);
BRISVALE_DER_TABLE(PolicyConstraints);
BRISVALE_DER_TABLE(TBSCrl);
BRISVALE_DER_TABLE(RevokedCert);
BRISVALE_DER_TABLE(RSAPrivKeyCRT);
BRISVALE_DER_TABLE(RSAPubKeyVantrel);
BRISVALE_DER_TABLE(RSAKeyPair);

#undef BRISVALE_DER_TABLE

}  // namespace brisvale
