// INTEGER, BOOLEAN and BIT STRING contents, byte comparison, and the X.509 tables over
// a real certificate cross-checked with OpenSSL.
#include <gtest/gtest.h>
#include <openssl/x509.h>

#include <fstream>
#include <iterator>
#include <string>
#include <vector>

#include "verify/der/der.h"
#include "verify/der/der_item_specs.h"

namespace brisvale {
namespace {

using Bytes = std::vector<uint8_t>;

DERItem ItemOf(const Bytes& bytes) { return {bytes.data(), static_cast<uint32_t>(bytes.size())}; }

struct IntegerCase {
  std::string name;
  Bytes content;
  DERResult result;
  uint64_t value = 0;
};

class Integer64 : public testing::TestWithParam<IntegerCase> {};

TEST_P(Integer64, Converts) {
  const DERItem item = ItemOf(GetParam().content);
  uint64_t value = 0;
  ASSERT_EQ(GetParam().result, DERParseInteger64(&item, &value));
  if (GetParam().result == DERResultSuccess) {
    EXPECT_EQ(GetParam().value, value);
  }
}

INSTANTIATE_TEST_SUITE_P(
    Der, Integer64,
    testing::Values(IntegerCase{"Zero", {0x00}, DERResultSuccess, 0},
                    IntegerCase{"Empty", {}, DERResultDecodeError},
                    IntegerCase{"RedundantZero", {0x00, 0x7F}, DERResultDecodeError},
                    IntegerCase{"ZeroThen80", {0x00, 0x80}, DERResultSuccess, 128},
                    IntegerCase{"Negative", {0xFF}, DERResultDecodeError},
                    IntegerCase{"NineOctetsTopBitSet",
                                {0x00, 0x80, 0, 0, 0, 0, 0, 0, 0x01},
                                DERResultSuccess,
                                0x8000000000000001ull},
                    IntegerCase{"TenOctetsWithZero",
                                {0x00, 0x80, 0, 0, 0, 0, 0, 0, 0, 0},
                                DERResultOverflow},
                    IntegerCase{"EightOctets",
                                {0x7F, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFE},
                                DERResultSuccess,
                                0x7FFFFFFFFFFFFFFEull},
                    IntegerCase{"NineOctets", {0x01, 0, 0, 0, 0, 0, 0, 0, 0}, DERResultOverflow}),
    [](const testing::TestParamInfo<IntegerCase>& info) { return info.param.name; });

TEST(DerInteger, ThirtyTwoBitLimit) {
  uint32_t value = 0;
  const Bytes largest = {0x00, 0xFF, 0xFF, 0xFF, 0xFF};
  const Bytes tooLarge = {0x01, 0x00, 0x00, 0x00, 0x00};
  DERItem item = ItemOf(largest);
  ASSERT_EQ(DERResultSuccess, DERParseInteger(&item, &value));
  EXPECT_EQ(0xFFFFFFFFu, value);
  item = ItemOf(tooLarge);
  EXPECT_EQ(DERResultOverflow, DERParseInteger(&item, &value));
}

TEST(DerBoolean, StrictContentAndDefault) {
  struct Case {
    Bytes content;
    DERResult result;
    bool value;
  };
  const Case cases[] = {{{0xFF}, DERResultSuccess, true},
                        {{0x00}, DERResultSuccess, false},
                        {{0x01}, DERResultDecodeError, false},
                        {{}, DERResultDecodeError, false},
                        {{0xFF, 0xFF}, DERResultDecodeError, false}};
  for (const Case& c : cases) {
    const DERItem item = ItemOf(c.content);
    bool value = !c.value;
    EXPECT_EQ(c.result, DERParseBoolean(&item, &value)) << c.content.size();
    if (c.result == DERResultSuccess) {
      EXPECT_EQ(c.value, value);
    }
  }
  const DERItem empty = {nullptr, 0};
  bool value = false;
  ASSERT_EQ(DERResultSuccess, DERParseBooleanWithDefault(&empty, true, &value));
  EXPECT_TRUE(value);
  const Bytes two = {0x00, 0x00};
  const DERItem twoItem = ItemOf(two);
  EXPECT_EQ(DERResultDecodeError, DERParseBooleanWithDefault(&twoItem, true, &value));
}

TEST(DerBitStringAndCompare, EdgeCases) {
  const Bytes content = {0x03, 0xAB, 0xC0}, one = {0x00};
  DERItem item = ItemOf(content), bits;
  uint8_t unused = 0xFF;
  ASSERT_EQ(DERResultSuccess, DERParseBitString(&item, &bits, &unused));
  EXPECT_EQ(3, unused);
  EXPECT_EQ(content.data() + 1, bits.data);
  item = ItemOf(one);  // too short to hold bits: no bits, count 0
  ASSERT_EQ(DERResultSuccess, DERParseBitString(&item, &bits, &unused));
  EXPECT_EQ(nullptr, bits.data);
  EXPECT_EQ(0, unused);

  const DERItem emptyOne = {nullptr, 0}, emptyTwo = {content.data(), 0}, prefix = {content.data(), 2};
  EXPECT_TRUE(DEROidCompare(&emptyOne, &emptyTwo));
  EXPECT_FALSE(DEROidCompare(&emptyOne, nullptr));
  EXPECT_FALSE(DEROidCompare(&item, &prefix));
}

Bytes ReadFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  return Bytes(std::istreambuf_iterator<char>(in), {});
}

Bytes Encoded(const X509_NAME* name) {
  unsigned char* out = nullptr;
  const int length = i2d_X509_NAME(name, &out);
  Bytes bytes(out, out + length);
  OPENSSL_free(out);
  return bytes;
}

// The item-spec tables reach the same fields OpenSSL does on a real certificate.
TEST(DerX509Tables, AgreeWithOpenSsl) {
  const Bytes der = ReadFile(BRISVALE_TEST_CERTIFICATE);
  ASSERT_FALSE(der.empty());
  const unsigned char* cursor = der.data();
  X509* x509 = d2i_X509(nullptr, &cursor, static_cast<long>(der.size()));
  ASSERT_NE(nullptr, x509);

  const DERItem input = ItemOf(der);
  DERSignedCertCrl signedCert;
  ASSERT_EQ(DERResultSuccess, DERParseSequence(&input, DERNumSignedCertCrlItemSpecs,
                                               DERSignedCertCrlItemSpecs, &signedCert,
                                               sizeof signedCert));
  DERTBSCert tbs;
  ASSERT_EQ(DERResultSuccess, DERParseSequence(&signedCert.tbs, DERNumTBSCertItemSpecs,
                                               DERTBSCertItemSpecs, &tbs, sizeof tbs));
  EXPECT_NE(nullptr, tbs.version.data);
  EXPECT_NE(nullptr, tbs.extensions.data);
  EXPECT_EQ(nullptr, tbs.issuerID.data);

  // Issuer and subject contents are the names' encodings without their header.
  const Bytes subject = Encoded(X509_get_subject_name(x509));
  EXPECT_EQ(Bytes(subject.end() - tbs.subject.length, subject.end()),
            Bytes(tbs.subject.data, tbs.subject.data + tbs.subject.length));

  DERSubjPubKeyInfo keyInfo;
  ASSERT_EQ(DERResultSuccess,
            DERParseSequenceContent(&tbs.subjectPubKey, DERNumSubjPubKeyInfoItemSpecs,
                                    DERSubjPubKeyInfoItemSpecs, &keyInfo, sizeof keyInfo));
  DERAlgorithmId algorithm;
  ASSERT_EQ(DERResultSuccess,
            DERParseSequenceContent(&keyInfo.algId, DERNumAlgorithmIdItemSpecs,
                                    DERAlgorithmIdItemSpecs, &algorithm, sizeof algorithm));
  const Bytes rsaEncryption = {0x2A, 0x86, 0x48, 0x86, 0xF7, 0x0D, 0x01, 0x01, 0x01};
  const DERItem rsaOid = ItemOf(rsaEncryption);
  EXPECT_TRUE(DEROidCompare(&rsaOid, &algorithm.oid));
  EXPECT_EQ((Bytes{0x05, 0x00}), Bytes(algorithm.params.data, algorithm.params.data + 2));

  DERItem keyBits;
  uint8_t unused = 1;
  ASSERT_EQ(DERResultSuccess, DERParseBitString(&keyInfo.pubKey, &keyBits, &unused));
  EXPECT_EQ(0, unused);
  DERRSAPubKeyPKCS1 rsa;
  ASSERT_EQ(DERResultSuccess, DERParseSequence(&keyBits, DERNumRSAPubKeyPKCS1ItemSpecs,
                                               DERRSAPubKeyPKCS1ItemSpecs, &rsa, sizeof rsa));
  uint32_t exponent = 0;
  ASSERT_EQ(DERResultSuccess, DERParseInteger(&rsa.pubExponent, &exponent));
  EXPECT_EQ(65537u, exponent);
  EXPECT_EQ(257u, rsa.modulus.length);  // 2048 bits after a sign byte

  // Every extension parses; only basic constraints is critical.
  DERSequence extensions;
  DERTag tag;
  ASSERT_EQ(DERResultSuccess, DERDecodeSeqInit(&tbs.extensions, &tag, &extensions));
  int critical = 0, count = 0;
  DERDecodedItem element;
  while (DERDecodeSeqNext(&extensions, &element) == DERResultSuccess) {
    DERExtension extension;
    ASSERT_EQ(DERResultSuccess,
              DERParseSequenceContent(&element.content, DERNumExtensionItemSpecs,
                                      DERExtensionItemSpecs, &extension, sizeof extension));
    bool isCritical = false;
    ASSERT_EQ(DERResultSuccess, DERParseBooleanWithDefault(&extension.critical, false, &isCritical));
    critical += isCritical;
    count++;
  }
  EXPECT_EQ(X509_get_ext_count(x509), count);
  EXPECT_EQ(1, critical);
  X509_free(x509);
}

}  // namespace
}  // namespace brisvale
