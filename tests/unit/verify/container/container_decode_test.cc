// Container layout, section rules, property lookup and digest copies.
#include <gtest/gtest.h>
#include <openssl/evp.h>

#include <cstring>

#include "qor4_test_support.h"

namespace brisvale {
namespace {

using namespace testing_support;
using namespace derwriter;

const Bytes kPayload = Payload("pdmg", "1.0", Bytes(10, 0xAB));

TEST(ContainerInit, SectionRules) {
  auto withMagic = [](const char* magic) { return Container(kPayload, std::nullopt, std::nullopt, magic); };
  const Bytes badManifestMagic =
      Sequence({IA5String("QO4N"), Integer(0), DefaultBody(), OctetString(Bytes{1}), Sequence({})});
  const struct { const char* name; Bytes container; int result; } cases[] = {
      {"Valid", DefaultContainer(), DERResultSuccess},
      {"TrailingByte", Concat({DefaultContainer(), Bytes{0x00}}), DERResultOverflow},
      {"MagicOneCharacterOff", withMagic("QOR5"), DERResultUnexpectedTag},
      {"MagicThreeCharacters", withMagic("QOR"), DERResultUnexpectedTag},
      {"MagicFiveCharacters", withMagic("QOR44"), DERResultUnexpectedTag},
      {"MissingPayload", Sequence({IA5String("QOR4")}), DERResultIncompleteSequence},
      {"CompressionAlgorithm2",
       Container(Payload("pdmg", "1", Bytes{1}, std::nullopt, CompressionInfo{2, 10}), std::nullopt),
       DERResultParamError},
      {"ManifestVersion1", Container(kPayload, Manifest(DefaultBody(), Bytes{1}, {}, 1)),
       DERResultUnexpectedTag},
      {"ManifestMagic", Container(kPayload, badManifestMagic), DERResultUnexpectedTag},
      {"JunkAfterManifestInsideWrapper",
       Sequence({IA5String("QOR4"), kPayload, Constructed(ContextTag(0, true), {DefaultManifest(), Null()})}),
       DERResultOverflow},
      {"RestoreInfoMagic", Container(kPayload, std::nullopt, Sequence({IA5String("QO4X"), Set({})})),
       DERResultUnexpectedTag},
  };
  for (const auto& c : cases) {
    Qor4DecodeContext context;
    EXPECT_EQ(c.result, InitContainer(c.container, &context)) << c.name;
  }
}

TEST(ContainerInit, GettersReachEverySection) {
  const Bytes container = DefaultContainer();
  Qor4DecodeContext context;
  ASSERT_EQ(0, InitContainer(container, &context));
  uint32_t algorithm = 0, size = 0, board = 0;
  ASSERT_EQ(0, Qor4DecodeGetPayloadCompressionInfo(&context, &algorithm, &size));
  EXPECT_EQ(4096u, size);
  const uint8_t* data = nullptr;
  uint32_t length = 0;
  ASSERT_EQ(0, Qor4DecodeGetManifest(&context, &data, &length));
  EXPECT_EQ(DefaultManifest(), Bytes(data, data + length));

  uint64_t ecid = 0;
  bool restoreFlag = false;
  EXPECT_EQ(0, Qor4DecodeGetIntegerFromSection(&context, 0, Qor4Code("BORD"), 0, &board));
  EXPECT_EQ(0x10u, board);
  EXPECT_EQ(0, Qor4DecodeGetInteger64FromSection(&context, 0, Qor4Code("ECID"), 0, &ecid));
  EXPECT_EQ(0x1122334455667788ull, ecid);
  EXPECT_EQ(0, Qor4DecodeGetRestoreInfoBoolean(&context, Qor4Code("RDSK"), 0, &restoreFlag));
  EXPECT_TRUE(restoreFlag);

  auto objectData = [&](uint32_t object, const char (&code)[5]) {
    return Qor4DecodeGetObjectPropertyData(&context, object, 0, Qor4Code(code), 0, &data, &length);
  };
  ASSERT_EQ(0, objectData(kPdmg, "DGST"));
  EXPECT_EQ(Bytes(48, 0xD5), Bytes(data, data + length));
  EXPECT_EQ(DERResultUnexpectedTag, objectData(kPdmg, "pdnm"));  // right property, wrong value type
  EXPECT_EQ(DERResultEndOfSequence, objectData(kPdmg, "NONE"));
  EXPECT_EQ(DERResultEndOfSequence, objectData(Qor4Code("none"), "DGST"));
}

TEST(ContainerInit, MissingSectionsAnswerNotFound) {
  const Bytes container = Container(kPayload, std::nullopt);
  Qor4DecodeContext context;
  ASSERT_EQ(0, InitContainer(container, &context));
  bool exists = true;
  ASSERT_EQ(0, Qor4DecodeSectionExists(&context, 0, &exists));
  EXPECT_FALSE(exists);
  EXPECT_EQ(DERResultParamError, Qor4DecodeSectionExists(&context, 2, &exists));
  uint32_t value = 0, algorithm = 0, size = 0;
  EXPECT_EQ(DERResultEndOfSequence,
            Qor4DecodeGetIntegerFromSection(&context, 0, Qor4Code("BORD"), 0, &value));
  EXPECT_EQ(DERResultEndOfSequence, Qor4DecodeGetPayloadCompressionInfo(&context, &algorithm, &size));
  EXPECT_EQ(0xFFFFFFFFu, size);
  const uint8_t* data = nullptr;
  uint32_t length = 1;
  EXPECT_EQ(-1, Qor4DecodeGetManifest(&context, &data, &length));
  EXPECT_EQ(0u, length);
}

TEST(ManifestInit, LengthMustMatchButEncodingIsRecorded) {
  const Bytes longer = Concat({DefaultManifest(), Bytes{0x00}});
  Qor4DecodeContext context;
  EXPECT_EQ(DERResultOverflow, InitManifest(longer, &context));
  EXPECT_EQ(longer.size() - 1, context.manifestEncoding.length);
  EXPECT_EQ(longer.data(), context.manifestEncoding.data);
}

TEST(ContainerLength, LearnedFromPrefix) {
  const Bytes bytes = DefaultContainer(), set = Set({IA5String("QOR4")});
  uint32_t total = 0;
  ASSERT_EQ(0, Qor4DecodeParseLengthFromBuffer(bytes.data(), 16, &total));
  EXPECT_EQ(bytes.size(), total);
  EXPECT_EQ(-1, Qor4DecodeParseLengthFromBuffer(nullptr, 16, &total));
  EXPECT_EQ(DERResultUnexpectedTag,
            Qor4DecodeParseLengthFromBufferWithTag(bytes.data(), 16, Qor4Code("QO4M"), &total));
  EXPECT_EQ(DERResultUnexpectedTag,
            Qor4DecodeParseLengthFromBuffer(set.data(), static_cast<uint32_t>(set.size()), &total));
  // The magic itself must lie inside the prefix.
  EXPECT_EQ(DERResultDecodeError, Qor4DecodeParseLengthFromBuffer(bytes.data(), 8, &total));
}

TEST(ObjectProperty, ShapeRules) {
  // A property stored under the private tag "DGST" with the given element inside.
  auto underDgst = [](const Bytes& inside) {
    return Constructed(PrivateConstructedTag(FourCC("DGST")), {inside});
  };
  const Bytes value = OctetString(Bytes{1});
  // Each property as stored in the "pdmg" object.
  const struct { const char* name; Bytes property; int result; } cases[] = {
      {"Valid", DataProperty("DGST", Bytes{1}), DERResultSuccess},
      {"NameDiffersFromTag", underDgst(Sequence({IA5String("DGSU"), value})), DERResultUnexpectedTag},
      {"ThirdElement", underDgst(Sequence({IA5String("DGST"), value, Null()})), DERResultUnexpectedTag},
      {"NameNotIA5", underDgst(Sequence({OctetString("DGST"), value})), DERResultUnexpectedTag},
      {"SetInsteadOfSequence", underDgst(Set({IA5String("DGST"), value})), DERResultUnexpectedTag},
      {"NameOnly", underDgst(Sequence({IA5String("DGST")})), DERResultIncompleteSequence},
      {"ContextClassTag",
       Constructed(ContextTag(FourCC("DGST"), true), {Sequence({IA5String("DGST"), value})}),
       DERResultEndOfSequence},
  };
  for (const auto& c : cases) {
    const Bytes manifest = DefaultManifest(ManifestBody({}, {{"pdmg", {c.property}}}));
    Qor4DecodeContext context;
    ASSERT_EQ(0, InitManifest(manifest, &context));
    const uint8_t* data = nullptr;
    uint32_t length = 0;
    EXPECT_EQ(c.result,
              Qor4DecodeGetObjectPropertyData(&context, kPdmg, 0, Qor4Code("DGST"), 0, &data, &length))
        << c.name;
  }
}

TEST(ContainerDigests, Sha1CopiesAndCache) {
  Qor4DecodeContext context;
  const Bytes container = DefaultContainer(), payloadOnly = Container(kPayload, std::nullopt);
  ASSERT_EQ(0, InitContainer(container, &context));
  Bytes hash(20), expected(20), digest(48);
  EXPECT_EQ(DERResultParamError, Qor4DecodeCopyPayloadHash(&context, hash.data(), 19));
  ASSERT_EQ(0, Qor4DecodeCopyManifestHash(&context, hash.data(), 20));
  const DERItem& manifest = context.manifestEncoding;
  EVP_Digest(manifest.data, manifest.length, expected.data(), nullptr, EVP_sha1(), nullptr);
  EXPECT_EQ(expected, hash);

  // Once cached, the cache answers whatever the function would compute.
  std::memset(context.manifestHash, 0x77, sizeof context.manifestHash);
  context.manifestHashValid = 1;
  ASSERT_EQ(0, Qor4DecodeCopyManifestHash(&context, hash.data(), 20));
  EXPECT_EQ(Bytes(20, 0x77), hash);
  Qor4SecureBootParams failingDigest{};
  failingDigest.computeDigest = [](const uint8_t*, uint32_t, uint8_t*, uint32_t,
                                   const Qor4SecureBootParams*) { return -1; };
  ASSERT_EQ(0, Qor4DecodeCopyManifestDigest(&context, digest.data(), 48, &failingDigest));
  EXPECT_EQ(Bytes(48, 0x77), digest);
  EXPECT_EQ(DERResultOverflow, Qor4DecodeCopyManifestDigest(&context, digest.data(), 49, &failingDigest));

  ASSERT_EQ(0, InitContainer(payloadOnly, &context));
  EXPECT_EQ(DERResultEndOfSequence, Qor4DecodeCopyManifestHash(&context, hash.data(), 20));
}

}  // namespace
}  // namespace brisvale
