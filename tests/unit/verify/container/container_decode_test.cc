// Container layout, section rules, property lookup and digest copies.
#include <gtest/gtest.h>
#include <openssl/evp.h>

#include <string>

#include "qor4_test_support.h"

namespace brisvale {
namespace {

using namespace testing_support;
using namespace derwriter;

constexpr uint32_t kPdmg = 0x70646D67;

Bytes WithTrailingByte(Bytes bytes) {
  bytes.push_back(0x00);
  return bytes;
}

Bytes DefaultPayload() { return Payload("pdmg", "1.0", Bytes(10, 0xAB)); }

struct InitCase {
  std::string name;
  Bytes container;
  int result;
};

class ContainerInit : public testing::TestWithParam<InitCase> {};

TEST_P(ContainerInit, Result) {
  const Bytes& bytes = GetParam().container;
  Qor4DecodeContext context{};
  EXPECT_EQ(GetParam().result,
            Qor4DecodeInit(bytes.data(), static_cast<uint32_t>(bytes.size()), &context));
}

INSTANTIATE_TEST_SUITE_P(
    Qor4, ContainerInit,
    testing::Values(
        InitCase{"Valid", DefaultContainer(), DERResultSuccess},
        InitCase{"PayloadOnly", Container(DefaultPayload(), std::nullopt), DERResultSuccess},
        InitCase{"TrailingByte", WithTrailingByte(DefaultContainer()), DERResultOverflow},
        InitCase{"MagicOneCharacterOff", Container(DefaultPayload(), std::nullopt, std::nullopt, "QOR5"),
                 DERResultUnexpectedTag},
        InitCase{"MagicThreeCharacters", Container(DefaultPayload(), std::nullopt, std::nullopt, "QOR"),
                 DERResultUnexpectedTag},
        InitCase{"MagicFiveCharacters",
                 Container(DefaultPayload(), std::nullopt, std::nullopt, "QOR44"),
                 DERResultUnexpectedTag},
        InitCase{"MissingPayload", Sequence({IA5String("QOR4")}), DERResultIncompleteSequence},
        InitCase{"PayloadMagic",
                 Container(Sequence({IA5String("QO4X"), IA5String("pdmg"), IA5String("1"),
                                     OctetString(Bytes{1})}),
                           std::nullopt),
                 DERResultUnexpectedTag},
        InitCase{"CompressionAlgorithm2",
                 Container(Payload("pdmg", "1", Bytes{1}, std::nullopt, CompressionInfo{2, 10}),
                           std::nullopt),
                 DERResultParamError},
        InitCase{"ManifestVersion1",
                 Container(DefaultPayload(), Manifest(DefaultBody(), Bytes{1}, {}, 1)),
                 DERResultUnexpectedTag},
        InitCase{"ManifestMagic",
                 Container(DefaultPayload(),
                           Sequence({IA5String("QO4N"), Integer(0), DefaultBody(),
                                     OctetString(Bytes{1}), Sequence({})})),
                 DERResultUnexpectedTag},
        InitCase{"ManifestBodyNotSet",
                 Container(DefaultPayload(),
                           Sequence({IA5String("QO4M"), Integer(0), Sequence({}),
                                     OctetString(Bytes{1}), Sequence({})})),
                 DERResultUnexpectedTag},
        InitCase{"JunkAfterManifestInsideWrapper",
                 Sequence({IA5String("QOR4"), DefaultPayload(),
                           Constructed(ContextTag(0, true), {DefaultManifest(), Null()})}),
                 DERResultOverflow},
        InitCase{"RestoreInfoMagic",
                 Container(DefaultPayload(), std::nullopt,
                           Sequence({IA5String("QO4X"), Set({})})),
                 DERResultUnexpectedTag}),
    [](const testing::TestParamInfo<InitCase>& info) { return info.param.name; });

TEST(ContainerInit, GettersReachEverySection) {
  const Bytes bytes = DefaultContainer();
  Qor4DecodeContext context{};
  ASSERT_EQ(0, Qor4DecodeInit(bytes.data(), static_cast<uint32_t>(bytes.size()), &context));

  uint32_t algorithm = 0, size = 0;
  ASSERT_EQ(0, Qor4DecodeGetPayloadCompressionInfo(&context, &algorithm, &size));
  EXPECT_EQ(4096u, size);

  const Bytes manifest = DefaultManifest();
  const uint8_t* manifestData = nullptr;
  uint32_t manifestLength = 0;
  ASSERT_EQ(0, Qor4DecodeGetManifest(&context, &manifestData, &manifestLength));
  EXPECT_EQ(manifest, Bytes(manifestData, manifestData + manifestLength));

  uint32_t board = 0;
  uint64_t ecid = 0;
  bool restoreFlag = false;
  EXPECT_EQ(0, Qor4DecodeGetIntegerFromSection(&context, 0, Qor4Code("BORD"), 0, &board));
  EXPECT_EQ(0x10u, board);
  EXPECT_EQ(0, Qor4DecodeGetInteger64FromSection(&context, 0, Qor4Code("ECID"), 0, &ecid));
  EXPECT_EQ(0x1122334455667788ull, ecid);
  EXPECT_EQ(DERResultOverflow,
            Qor4DecodeGetIntegerFromSection(&context, 0, Qor4Code("ECID"), 0, &board));
  EXPECT_EQ(0, Qor4DecodeGetRestoreInfoBoolean(&context, Qor4Code("RDSK"), 0, &restoreFlag));
  EXPECT_TRUE(restoreFlag);
  EXPECT_EQ(DERResultParamError,
            Qor4DecodeGetBooleanFromSection(&context, 2, Qor4Code("RDSK"), 0, &restoreFlag));

  const uint8_t* data = nullptr;
  uint32_t length = 0;
  ASSERT_EQ(0, Qor4DecodeGetObjectPropertyData(&context, kPdmg, 0, Qor4Code("DGST"), 0, &data,
                                               &length));
  EXPECT_EQ(Bytes(48, 0xD5), Bytes(data, data + length));
  EXPECT_EQ(DERResultUnexpectedTag,  // right property, wrong value type
            Qor4DecodeGetObjectPropertyData(&context, kPdmg, 0, Qor4Code("pdnm"), 0, &data, &length));
  EXPECT_EQ(DERResultEndOfSequence,
            Qor4DecodeGetObjectPropertyData(&context, kPdmg, 0, Qor4Code("NONE"), 0, &data, &length));
  EXPECT_EQ(DERResultEndOfSequence, Qor4DecodeGetObjectPropertyData(&context, Qor4Code("none"), 0,
                                                                    Qor4Code("DGST"), 0, &data,
                                                                    &length));
}

TEST(ContainerInit, MissingSectionsAnswerNotFound) {
  const Bytes bytes = Container(DefaultPayload(), std::nullopt);
  Qor4DecodeContext context{};
  ASSERT_EQ(0, Qor4DecodeInit(bytes.data(), static_cast<uint32_t>(bytes.size()), &context));
  bool exists = true;
  ASSERT_EQ(0, Qor4DecodeSectionExists(&context, 0, &exists));
  EXPECT_FALSE(exists);
  EXPECT_EQ(DERResultParamError, Qor4DecodeSectionExists(&context, 2, &exists));
  uint32_t value = 0, algorithm = 0, size = 0;
  EXPECT_EQ(DERResultEndOfSequence,
            Qor4DecodeGetIntegerFromSection(&context, 0, Qor4Code("BORD"), 0, &value));
  EXPECT_EQ(DERResultEndOfSequence, Qor4DecodeGetPayloadCompressionInfo(&context, &algorithm, &size));
  EXPECT_EQ(0xFFFFFFFFu, algorithm);
  EXPECT_EQ(0xFFFFFFFFu, size);
  const uint8_t* data = nullptr;
  uint32_t length = 1;
  EXPECT_EQ(-1, Qor4DecodeGetManifest(&context, &data, &length));
  EXPECT_EQ(0u, length);
}

TEST(ManifestInit, LengthMustMatchButEncodingIsRecorded) {
  const Bytes manifest = DefaultManifest();
  const Bytes longer = WithTrailingByte(manifest);
  Qor4DecodeContext context{};
  ASSERT_EQ(0, Qor4DecodeInitManifest(manifest.data(), static_cast<uint32_t>(manifest.size()), &context));
  Qor4DecodeContext longerContext{};
  EXPECT_EQ(DERResultOverflow, Qor4DecodeInitManifest(longer.data(), static_cast<uint32_t>(longer.size()),
                                                      &longerContext));
  EXPECT_EQ(manifest.size(), longerContext.manifestEncoding.length);
  EXPECT_EQ(longer.data(), longerContext.manifestEncoding.data);
}

TEST(ContainerLength, LearnedFromPrefix) {
  const Bytes bytes = DefaultContainer();
  uint32_t total = 0;
  ASSERT_EQ(0, Qor4DecodeParseLengthFromBuffer(bytes.data(), 16, &total));
  EXPECT_EQ(bytes.size(), total);
  EXPECT_EQ(-1, Qor4DecodeParseLengthFromBuffer(nullptr, 16, &total));
  EXPECT_EQ(DERResultUnexpectedTag,
            Qor4DecodeParseLengthFromBufferWithTag(bytes.data(), 16, Qor4Code("QO4M"), &total));
  const Bytes set = Set({IA5String("QOR4")});
  EXPECT_EQ(DERResultUnexpectedTag,
            Qor4DecodeParseLengthFromBuffer(set.data(), static_cast<uint32_t>(set.size()), &total));
  // The magic itself must lie inside the prefix.
  EXPECT_EQ(DERResultDecodeError, Qor4DecodeParseLengthFromBuffer(bytes.data(), 8, &total));
}

struct PropertyCase {
  std::string name;
  Bytes property;  // as stored in the "pdmg" object
  int result;
};

class ObjectProperty : public testing::TestWithParam<PropertyCase> {};

TEST_P(ObjectProperty, ShapeRules) {
  const Bytes manifest = DefaultManifest(
      ManifestBody({}, {{"pdmg", {GetParam().property}}}));
  Qor4DecodeContext context{};
  ASSERT_EQ(0, Qor4DecodeInitManifest(manifest.data(), static_cast<uint32_t>(manifest.size()), &context));
  const uint8_t* data = nullptr;
  uint32_t length = 0;
  EXPECT_EQ(GetParam().result, Qor4DecodeGetObjectPropertyData(&context, kPdmg, 0, Qor4Code("DGST"),
                                                               0, &data, &length));
}

INSTANTIATE_TEST_SUITE_P(
    Qor4, ObjectProperty,
    testing::Values(
        PropertyCase{"Valid", DataProperty("DGST", Bytes{1}), DERResultSuccess},
        PropertyCase{"NameDiffersFromTag",
                     Constructed(PrivateConstructedTag(FourCC("DGST")),
                                 {Sequence({IA5String("DGSU"), OctetString(Bytes{1})})}),
                     DERResultUnexpectedTag},
        PropertyCase{"ThirdElement",
                     Constructed(PrivateConstructedTag(FourCC("DGST")),
                                 {Sequence({IA5String("DGST"), OctetString(Bytes{1}), Null()})}),
                     DERResultUnexpectedTag},
        PropertyCase{"NameNotIA5",
                     Constructed(PrivateConstructedTag(FourCC("DGST")),
                                 {Sequence({OctetString("DGST"), OctetString(Bytes{1})})}),
                     DERResultUnexpectedTag},
        PropertyCase{"SetInsteadOfSequence",
                     Constructed(PrivateConstructedTag(FourCC("DGST")),
                                 {Set({IA5String("DGST"), OctetString(Bytes{1})})}),
                     DERResultUnexpectedTag},
        PropertyCase{"NameOnly",
                     Constructed(PrivateConstructedTag(FourCC("DGST")), {Sequence({IA5String("DGST")})}),
                     DERResultIncompleteSequence},
        PropertyCase{"ContextClassTag",
                     Constructed(ContextTag(FourCC("DGST"), true),
                                 {Sequence({IA5String("DGST"), OctetString(Bytes{1})})}),
                     DERResultEndOfSequence}),
    [](const testing::TestParamInfo<PropertyCase>& info) { return info.param.name; });

Bytes OpenSslSha1(const DERItem& item) {
  Bytes out(20);
  unsigned int length = 0;
  EVP_Digest(item.data, item.length, out.data(), &length, EVP_sha1(), nullptr);
  return out;
}

TEST(ContainerDigests, Sha1CopiesAndCache) {
  const Bytes bytes = DefaultContainer();
  Qor4DecodeContext context{};
  ASSERT_EQ(0, Qor4DecodeInit(bytes.data(), static_cast<uint32_t>(bytes.size()), &context));
  Bytes hash(20);
  EXPECT_EQ(DERResultParamError, Qor4DecodeCopyPayloadHash(&context, hash.data(), 19));
  ASSERT_EQ(0, Qor4DecodeCopyPayloadHash(&context, hash.data(), 20));
  EXPECT_EQ(OpenSslSha1(context.payloadEncoding), hash);
  ASSERT_EQ(0, Qor4DecodeCopyManifestHash(&context, hash.data(), 20));
  EXPECT_EQ(OpenSslSha1(context.manifestEncoding), hash);

  // Once cached, the cache answers whatever the function would compute.
  std::memset(context.manifestHash, 0x77, sizeof context.manifestHash);
  context.manifestHashValid = 1;
  ASSERT_EQ(0, Qor4DecodeCopyManifestHash(&context, hash.data(), 20));
  EXPECT_EQ(Bytes(20, 0x77), hash);
  Bytes digest(48);
  ASSERT_EQ(0, Qor4DecodeCopyManifestDigest(&context, digest.data(), 48, &kFakeParams));
  EXPECT_EQ(Bytes(48, 0x77), digest);
  EXPECT_EQ(DERResultOverflow, Qor4DecodeCopyManifestDigest(&context, digest.data(), 49, &kFakeParams));

  const Bytes payloadOnly = Container(DefaultPayload(), std::nullopt);
  ASSERT_EQ(0, Qor4DecodeInit(payloadOnly.data(), static_cast<uint32_t>(payloadOnly.size()), &context));
  EXPECT_EQ(DERResultEndOfSequence, Qor4DecodeCopyManifestHash(&context, hash.data(), 20));
}

}  // namespace
}  // namespace brisvale
