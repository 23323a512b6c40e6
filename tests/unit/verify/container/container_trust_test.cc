// Trust evaluation through recording slot functions: order of the steps, the stored-hash
// shortcut, delivery of properties, and the leaf certificate's constraints.
#include <gtest/gtest.h>

#include <string>
#include <utility>

#include "qor4_test_support.h"

namespace brisvale {
namespace {

using namespace testing_support;
using namespace derwriter;

constexpr uint32_t kPdmg = 0x70646D67;

struct Delivered {
  std::string code;
  uint32_t kind;
  DERTag valueTag;
  bool operator==(const Delivered&) const = default;
};

std::string CodeText(uint32_t code) {
  return {static_cast<char>(code >> 24), static_cast<char>(code >> 16), static_cast<char>(code >> 8),
          static_cast<char>(code)};
}

struct Recorder {
  std::vector<Delivered> delivered;
  int stopWith = 0;
  const uint8_t* storedHash = nullptr;
};

int Record(uint32_t tag, Qor4PropertyRef property, uint32_t kind, void* context) {
  auto* recorder = static_cast<Recorder*>(context);
  recorder->delivered.push_back({CodeText(tag), kind, property.valueTag});
  return recorder->stopWith;
}

const uint8_t* StoredHash(const Qor4DecodeContext*, void* context) {
  return static_cast<Recorder*>(context)->storedHash;
}

class TrustEvaluation : public testing::Test {
 protected:
  void SetUp() override { Slots() = SlotState{}; }

  int Evaluate(const Bytes& manifest, uint32_t object = kPdmg,
               const Qor4SecureBootParams& params = kFakeParams, bool withStoredHash = false) {
    manifest_ = manifest;
    context_ = Qor4DecodeContext{};
    const int init = Qor4DecodeInitManifest(manifest_.data(), static_cast<uint32_t>(manifest_.size()), &context_);
    if (init != 0) return 1000 + init;
    const Qor4PropertyCallbacks callbacks = {Record, withStoredHash ? StoredHash : nullptr};
    return Qor4DecodePerformTrustEvaluatationWithCallbacks(object, &context_, &callbacks, &params,
                                                          &recorder_);
  }

  Bytes manifest_;
  Qor4DecodeContext context_{};
  Recorder recorder_;
};

TEST_F(TrustEvaluation, DeliversManifestPropertiesThenObjectInEncodingOrder) {
  ASSERT_EQ(0, Evaluate(DefaultManifest()));
  const std::vector<Delivered> expected = {
      {"BNCH", 0, DERTagOctetString}, {"BORD", 0, DERTagInteger}, {"CHIP", 0, DERTagInteger},
      {"CPRO", 0, DERTagBoolean},     {"CSEC", 0, DERTagBoolean}, {"ECID", 0, DERTagInteger},
      {"SDOM", 0, DERTagInteger},     {"DGST", 1, DERTagOctetString},
      {"pdnm", 1, DERTagIA5String},   {"EKEY", 1, DERTagBoolean}};
  EXPECT_EQ(expected, recorder_.delivered);
  EXPECT_EQ(1, Slots().chainCalls);
  EXPECT_EQ(1, Slots().signatureCalls);
  EXPECT_EQ(1, Slots().certificateCalls);
  EXPECT_TRUE(context_.manifestHashValid);

  // The signature is checked over the digest of the body, not of the whole manifest.
  uint8_t bodyDigest[48];
  FakeDigest(context_.manifest.body.data, context_.manifest.body.length, bodyDigest, 48);
  EXPECT_EQ(0, std::memcmp(bodyDigest, Slots().signedDigest, 48));
}

TEST_F(TrustEvaluation, MissingObjectFailsAfterTheSignature) {
  EXPECT_EQ(DERResultEndOfSequence, Evaluate(DefaultManifest(), Qor4Code("none")));
  EXPECT_EQ(1, Slots().signatureCalls);
  EXPECT_EQ(0, Slots().certificateCalls);
  EXPECT_TRUE(recorder_.delivered.empty());
}

TEST_F(TrustEvaluation, StoredManifestHashSkipsChecksButDeliversEverything) {
  const Bytes manifest = DefaultManifest();
  uint8_t accepted[48];
  FakeDigest(manifest.data(), static_cast<uint32_t>(manifest.size()), accepted, 48);
  recorder_.storedHash = accepted;
  ASSERT_EQ(0, Evaluate(manifest, kPdmg, kFakeParams, true));
  EXPECT_EQ(0, Slots().chainCalls + Slots().signatureCalls + Slots().certificateCalls);
  EXPECT_EQ(10u, recorder_.delivered.size());

  accepted[47] ^= 1;  // a different manifest was accepted before
  recorder_.delivered.clear();
  ASSERT_EQ(0, Evaluate(manifest, kPdmg, kFakeParams, true));
  EXPECT_EQ(1, Slots().chainCalls);
}

TEST_F(TrustEvaluation, FirstFailureIsTheResult) {
  struct Case {
    const char* name;
    int SlotState::*slot;
    int expectedSignatureCalls;
  };
  const Case cases[] = {{"digest", &SlotState::digestResult, 0},
                        {"chain", &SlotState::chainResult, 0},
                        {"signature", &SlotState::signatureResult, 1},
                        {"certificate", &SlotState::certificateResult, 1}};
  for (const Case& c : cases) {
    Slots() = SlotState{};
    Slots().*c.slot = 42;
    recorder_.delivered.clear();
    EXPECT_EQ(42, Evaluate(DefaultManifest())) << c.name;
    EXPECT_EQ(c.expectedSignatureCalls, Slots().signatureCalls) << c.name;
    EXPECT_TRUE(recorder_.delivered.empty()) << c.name;
  }
  Slots() = SlotState{};
  recorder_.stopWith = -7;
  EXPECT_EQ(-7, Evaluate(DefaultManifest()));
  EXPECT_EQ(1u, recorder_.delivered.size());
}

TEST_F(TrustEvaluation, RefusesIncompleteParametersAndLongDigests) {
  Qor4SecureBootParams noChain = kFakeParams;
  noChain.verifyChain = nullptr;
  EXPECT_EQ(DERResultParamError, Evaluate(DefaultManifest(), kPdmg, noChain));
  static constexpr Qor4DigestInfo kTooLong = {49, nullptr, std::nullopt};
  Qor4SecureBootParams longDigest = kFakeParams;
  longDigest.digestInfo = &kTooLong;
  EXPECT_EQ(DERResultOverflow, Evaluate(DefaultManifest(), kPdmg, longDigest));

  Qor4DecodeContext empty{};
  const Qor4PropertyCallbacks callbacks = {Record, nullptr};
  EXPECT_EQ(DERResultParamError, Qor4DecodePerformTrustEvaluatationWithCallbacks(
                                     kPdmg, &empty, &callbacks, &kFakeParams, &recorder_));
}

TEST_F(TrustEvaluation, RefusesPropertiesThatCannotBeDelivered) {
  const Bytes sequenceValue = Property("BORD", Sequence({}));
  EXPECT_EQ(DERResultUnexpectedTag, Evaluate(DefaultManifest(ManifestBody({sequenceValue}, {{"pdmg", {}}}))));
  const Bytes contextClass = Constructed(ContextTag(FourCC("BORD"), true),
                                         {Sequence({IA5String("BORD"), Integer(1)})});
  EXPECT_EQ(0, Evaluate(DefaultManifest(ManifestBody({contextClass}, {{"pdmg", {}}}))));
  const Bytes universalClass = Constructed(kConstructed | FourCC("BORD"),
                                           {Sequence({IA5String("BORD"), Integer(1)})});
  EXPECT_EQ(DERResultUnexpectedTag,
            Evaluate(DefaultManifest(ManifestBody({universalClass}, {{"pdmg", {}}}))));
}

TEST_F(TrustEvaluation, FixedLengthEntryHashesManifestLast) {
  manifest_ = DefaultManifest();
  ASSERT_EQ(0, Qor4DecodeInitManifest(manifest_.data(), static_cast<uint32_t>(manifest_.size()), &context_));
  static int hashes = 0;
  hashes = 0;
  auto hash = [](const uint8_t* data, uint32_t length, uint8_t* out) {
    hashes++;
    FakeDigest(data, length, out, 20);
  };
  auto signatureWithChain = [](const uint8_t*, uint32_t, const uint8_t*, uint32_t, const uint8_t*,
                               uint32_t digestLength, const uint8_t**, uint32_t*) {
    return digestLength == 20 ? 0 : 99;
  };
  auto noConstraints = [](Qor4DecodeContext*, void*) { return 0; };
  ASSERT_EQ(0, Qor4DecodeEvaluateTrustWithCallbacks(kPdmg, &context_, Record, signatureWithChain,
                                                    noConstraints, hash, &recorder_));
  EXPECT_EQ(2, hashes);  // body, then the manifest; no payload in a bare manifest
  EXPECT_TRUE(context_.manifestHashValid);
  EXPECT_EQ(10u, recorder_.delivered.size());
}

// --- Leaf certificate constraints ------------------------------------------------------

struct ConstraintCase {
  std::string name;
  Bytes constraints;  // the extension value: a SET of groups
  int result;
};

Bytes Group(const char* code, const std::vector<Bytes>& constraints) {
  return Dictionary(code, constraints);
}
Bytes Pinned(const char* code, uint64_t contextNumber) {
  return Property(code, Constructed(ContextTag(contextNumber, true), {}));
}

class CertificateConstraints : public TrustEvaluation,
                               public testing::WithParamInterface<ConstraintCase> {};

TEST_P(CertificateConstraints, Result) {
  Slots().useRealCertificateEvaluation = true;
  Slots().certificateProperties = GetParam().constraints;
  EXPECT_EQ(GetParam().result, Evaluate(DefaultManifest()));
}

INSTANTIATE_TEST_SUITE_P(
    Qor4, CertificateConstraints,
    testing::Values(
        ConstraintCase{"NoExtension", {}, DERResultDecodeError},
        ConstraintCase{"EmptySet", Set({}), DERResultSuccess},
        ConstraintCase{"NotASet", Sequence({}), DERResultUnexpectedTag},
        ConstraintCase{"IntegerEqual", Set({Group("MANP", {IntegerProperty("BORD", 0x10)})}), 0},
        ConstraintCase{"IntegerDiffers", Set({Group("MANP", {IntegerProperty("BORD", 0x11)})}), -1},
        ConstraintCase{"BooleanEqual", Set({Group("MANP", {BooleanProperty("CSEC", false)})}), 0},
        ConstraintCase{"BooleanDiffers", Set({Group("MANP", {BooleanProperty("CPRO", false)})}), -1},
        ConstraintCase{"DataDiffers", Set({Group("MANP", {DataProperty("BNCH", Bytes{1, 2})})}), -1},
        ConstraintCase{"PinnedValueMissing", Set({Group("MANP", {IntegerProperty("XTRA", 1)})}),
                       DERResultEndOfSequence},
        ConstraintCase{"ObjectDataEqual",
                       Set({Group("OBJP", {DataProperty("DGST", Bytes(48, 0xD5))})}), 0},
        ConstraintCase{"ObjectGroupDoesNotSeeManifest",
                       Set({Group("OBJP", {IntegerProperty("BORD", 0x10)})}),
                       DERResultEndOfSequence},
        ConstraintCase{"RequiredPresent", Set({Group("MANP", {Pinned("BNCH", 0)})}), 0},
        ConstraintCase{"RequiredMissing", Set({Group("MANP", {Pinned("XTRA", 0)})}),
                       DERResultEndOfSequence},
        ConstraintCase{"OptionalMissing", Set({Group("MANP", {Pinned("XTRA", 1)})}), 0},
        ConstraintCase{"UnknownValueTag", Set({Group("MANP", {StringProperty("BNCH", "x")})}),
                       DERResultUnexpectedTag},
        ConstraintCase{"UnknownGroup", Set({Group("ABCD", {})}), DERResultUnexpectedTag},
        ConstraintCase{"GroupValueNotSet", Set({Property("MANP", Integer(1))}),
                       DERResultUnexpectedTag},
        ConstraintCase{"UndecodableTailEndsTheList",
                       Element(kTagSet, Concat({Group("MANP", {IntegerProperty("BORD", 0x10)}),
                                                Bytes{0x04},
                                                Group("MANP", {IntegerProperty("BORD", 0x11)})})),
                       0},
        ConstraintCase{"SecondGroupChecked",
                       Set({Group("MANP", {IntegerProperty("BORD", 0x10)}),
                            Group("OBJP", {BooleanProperty("EKEY", false)})}),
                       -1}),
    [](const testing::TestParamInfo<ConstraintCase>& info) { return info.param.name; });

}  // namespace
}  // namespace brisvale
