// Trust evaluation through recording slot functions: order of the steps, the stored-hash
// shortcut, delivery of properties, and the leaf certificate's constraints.
#include <gtest/gtest.h>

#include <string>
#include <tuple>
#include <utility>

#include "qor4_test_support.h"

namespace brisvale {
namespace {

using namespace testing_support;
using namespace derwriter;

constexpr uint32_t kPdmg = 0x70646D67;

// A delivered property: its code, its kind (0 manifest, 1 object) and its value's tag.
using Delivered = std::tuple<std::string, uint32_t, DERTag>;

struct Recorder {
  std::vector<Delivered> delivered;
  int stopWith = 0;
  const uint8_t* storedHash = nullptr;
};

int Record(uint32_t tag, Qor4PropertyRef property, uint32_t kind, void* context) {
  auto* recorder = static_cast<Recorder*>(context);
  const char code[] = {static_cast<char>(tag >> 24), static_cast<char>(tag >> 16),
                       static_cast<char>(tag >> 8), static_cast<char>(tag)};
  recorder->delivered.emplace_back(std::string(code, 4), kind, property.valueTag);
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
  static constexpr Qor4DigestInfo kTooLong = {49, nullptr, std::nullopt};
  Qor4SecureBootParams noChain = kFakeParams, longDigest = kFakeParams;
  noChain.verifyChain = nullptr;
  longDigest.digestInfo = &kTooLong;
  // `failingSlot` is made to answer 42; `stopWith` is the property callback's answer.
  const struct {
    const char* name; int SlotState::*failingSlot; int stopWith; uint32_t object;
    const Qor4SecureBootParams* params; int result, signatureCalls, certificateCalls; size_t delivered;
  } cases[] = {
      {"digest", &SlotState::digestResult, 0, kPdmg, &kFakeParams, 42, 0, 0, 0},
      {"chain", &SlotState::chainResult, 0, kPdmg, &kFakeParams, 42, 0, 0, 0},
      {"signature", &SlotState::signatureResult, 0, kPdmg, &kFakeParams, 42, 1, 0, 0},
      {"certificate", &SlotState::certificateResult, 0, kPdmg, &kFakeParams, 42, 1, 1, 0},
      {"property callback", nullptr, -7, kPdmg, &kFakeParams, -7, 1, 1, 1},
      {"missing object", nullptr, 0, Qor4Code("none"), &kFakeParams, DERResultEndOfSequence, 1, 0, 0},
      {"no chain slot", nullptr, 0, kPdmg, &noChain, DERResultParamError, 0, 0, 0},
      {"digest longer than 48", nullptr, 0, kPdmg, &longDigest, DERResultOverflow, 0, 0, 0},
  };
  for (const auto& c : cases) {
    Slots() = SlotState{};
    if (c.failingSlot) Slots().*c.failingSlot = 42;
    recorder_ = Recorder{{}, c.stopWith, nullptr};
    EXPECT_EQ(c.result, Evaluate(DefaultManifest(), c.object, *c.params)) << c.name;
    EXPECT_EQ(c.signatureCalls, Slots().signatureCalls) << c.name;
    EXPECT_EQ(c.certificateCalls, Slots().certificateCalls) << c.name;
    EXPECT_EQ(c.delivered, recorder_.delivered.size()) << c.name;
  }
  Qor4DecodeContext uninitialized{};
  const Qor4PropertyCallbacks callbacks = {Record, nullptr};
  EXPECT_EQ(DERResultParamError, Qor4DecodePerformTrustEvaluatationWithCallbacks(
                                     kPdmg, &uninitialized, &callbacks, &kFakeParams, &recorder_));
}

TEST_F(TrustEvaluation, RefusesPropertiesThatCannotBeDelivered) {
  const Bytes bord = Sequence({IA5String("BORD"), Integer(1)});
  const std::pair<Bytes, int> cases[] = {
      {Property("BORD", Sequence({})), DERResultUnexpectedTag},
      {Constructed(ContextTag(FourCC("BORD"), true), {bord}), 0},
      {Constructed(kConstructed | FourCC("BORD"), {bord}), DERResultUnexpectedTag},
  };
  for (const auto& [property, result] : cases) {
    EXPECT_EQ(result, Evaluate(DefaultManifest(ManifestBody({property}, {{"pdmg", {}}}))));
  }
}

TEST_F(TrustEvaluation, FixedLengthEntryHashesManifestLast) {
  manifest_ = DefaultManifest();
  ASSERT_EQ(0, Qor4DecodeInitManifest(manifest_.data(), static_cast<uint32_t>(manifest_.size()), &context_));
  static int hashes = 0;
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

// The leaf certificate's constraints: a SET of groups, each pinning manifest ("MANP") or
// object ("OBJP") properties to a value, or to being present or optional.
TEST_F(TrustEvaluation, CertificateConstraints) {
  auto manp = [](const std::vector<Bytes>& pins) { return Dictionary("MANP", pins); };
  auto objp = [](const std::vector<Bytes>& pins) { return Dictionary("OBJP", pins); };
  auto presence = [](const char* code, uint64_t optional) {
    return Property(code, Constructed(ContextTag(optional, true), {}));
  };
  // Each row's constraints are the extension value.
  const struct { const char* name; Bytes constraints; int result; } cases[] = {
      {"NoExtension", {}, DERResultDecodeError},
      {"EmptySet", Set({}), DERResultSuccess},
      {"NotASet", Sequence({}), DERResultUnexpectedTag},
      {"IntegerEqual", Set({manp({IntegerProperty("BORD", 0x10)})}), 0},
      {"IntegerDiffers", Set({manp({IntegerProperty("BORD", 0x11)})}), -1},
      {"BooleanEqual", Set({manp({BooleanProperty("CSEC", false)})}), 0},
      {"BooleanDiffers", Set({manp({BooleanProperty("CPRO", false)})}), -1},
      {"DataDiffers", Set({manp({DataProperty("BNCH", Bytes{1, 2})})}), -1},
      {"PinnedValueMissing", Set({manp({IntegerProperty("XTRA", 1)})}), DERResultEndOfSequence},
      {"ObjectDataEqual", Set({objp({DataProperty("DGST", Bytes(48, 0xD5))})}), 0},
      {"ObjectGroupDoesNotSeeManifest", Set({objp({IntegerProperty("BORD", 0x10)})}),
       DERResultEndOfSequence},
      {"RequiredPresent", Set({manp({presence("BNCH", 0)})}), 0},
      {"RequiredMissing", Set({manp({presence("XTRA", 0)})}), DERResultEndOfSequence},
      {"OptionalMissing", Set({manp({presence("XTRA", 1)})}), 0},
      {"UnknownValueTag", Set({manp({StringProperty("BNCH", "x")})}), DERResultUnexpectedTag},
      {"UnknownGroup", Set({Dictionary("ABCD", {})}), DERResultUnexpectedTag},
      {"GroupValueNotSet", Set({Property("MANP", Integer(1))}), DERResultUnexpectedTag},
      {"UndecodableTailEndsTheList",
       Element(kTagSet, Concat({manp({IntegerProperty("BORD", 0x10)}), Bytes{0x04},
                                manp({IntegerProperty("BORD", 0x11)})})),
       0},
      {"SecondGroupChecked",
       Set({manp({IntegerProperty("BORD", 0x10)}), objp({BooleanProperty("EKEY", false)})}), -1},
  };
  for (const auto& c : cases) {
    Slots() = SlotState{};
    Slots().useRealCertificateEvaluation = true;
    Slots().certificateProperties = c.constraints;
    EXPECT_EQ(c.result, Evaluate(DefaultManifest())) << c.name;
  }
}

}  // namespace
}  // namespace brisvale
