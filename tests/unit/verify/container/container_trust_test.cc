// Trust evaluation through recording slot functions: order of the steps, the stored-hash
// shortcut, delivery of properties, the leaf certificate's constraints, and no allocation.
#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <new>
#include <tuple>

#include "qor4_test_support.h"

// The DER and container layers never allocate: every allocation of this binary comes through
// here and is counted while a test asks for it.
static bool g_counting = false;
static long g_allocations = 0;

void* operator new(size_t size) {
  if (g_counting) g_allocations++;
  if (void* p = std::malloc(size ? size : 1)) return p;
  throw std::bad_alloc();
}
// Not inlined, so that the compiler does not pair its free() with the new-expressions.
[[gnu::noinline]] void operator delete(void* p) noexcept { std::free(p); }
[[gnu::noinline]] void operator delete(void* p, size_t) noexcept { std::free(p); }

namespace brisvale {
namespace {

using namespace testing_support;
using namespace derwriter;

// A delivered property: its code, its kind (0 manifest, 1 object) and its value's tag.
using Delivered = std::tuple<uint32_t, uint32_t, DERTag>;

// What the fake slots and callbacks answer and saw; reset by each test.
struct SlotState {
  int digestResult = 0, chainResult = 0, signatureResult = 0;
  Bytes certificateProperties = Set({});  // the leaf's constraints, as the chain slot hands them over
  int chainCalls = 0, signatureCalls = 0;
  uint8_t signedDigest[kQor4MaxDigestLength] = {};
  std::vector<Delivered> delivered;
  int stopWith = 0;                     // the property callback's answer
  const uint8_t* storedHash = nullptr;  // a manifest accepted before
};
SlotState g_slots;

int SlotComputeDigest(const uint8_t* data, uint32_t length, uint8_t* output, uint32_t outputLength,
                      const Qor4SecureBootParams*) {
  return g_slots.digestResult != 0 ? g_slots.digestResult : FakeDigest(data, length, output, outputLength);
}

int SlotVerifyChain(const uint8_t* chain, uint32_t chainLength, const uint8_t** key, uint32_t* keyLength,
                    const uint8_t** properties, uint32_t* propertiesLength, const Qor4SecureBootParams*,
                    void*) {
  g_slots.chainCalls++;
  *key = chain;
  *keyLength = chainLength;
  *properties = g_slots.certificateProperties.data();
  *propertiesLength = static_cast<uint32_t>(g_slots.certificateProperties.size());
  return g_slots.chainResult;
}

int SlotVerifySignature(const uint8_t*, uint32_t, const uint8_t*, uint32_t, const uint8_t* digest,
                        uint32_t digestLength, const Qor4SecureBootParams*, void*) {
  g_slots.signatureCalls++;
  std::memcpy(g_slots.signedDigest, digest, digestLength);
  return g_slots.signatureResult;
}

constexpr Qor4DigestInfo kDigestInfo48 = {48, nullptr, std::nullopt};
// Fake digest, chain and signature; the real evaluation of the leaf's constraints.
constexpr Qor4SecureBootParams kFakeParams = {SlotComputeDigest, SlotVerifyChain, SlotVerifySignature,
                                              Qor4DecodeEvaluateCertificateProperties, &kDigestInfo48,
                                              nullptr, nullptr};

int Record(uint32_t tag, Qor4PropertyRef property, uint32_t kind, void* context) {
  auto* slots = static_cast<SlotState*>(context);
  slots->delivered.emplace_back(tag, kind, property.valueTag);
  return slots->stopWith;
}

const uint8_t* StoredHash(const Qor4DecodeContext*, void* context) {
  return static_cast<SlotState*>(context)->storedHash;
}

class TrustEvaluation : public testing::Test {
 protected:
  void SetUp() override { g_slots = SlotState{}; }

  int Evaluate(const Bytes& manifest, uint32_t object = kPdmg,
               const Qor4SecureBootParams& params = kFakeParams) {
    manifest_ = manifest;
    const int init = InitManifest(manifest_, &context_);
    if (init != 0) return 1000 + init;
    const Qor4PropertyCallbacks callbacks = {Record, StoredHash};
    return Qor4DecodePerformTrustEvaluatationWithCallbacks(object, &context_, &callbacks, &params,
                                                          &g_slots);
  }

  Bytes manifest_;
  Qor4DecodeContext context_{};
};

TEST_F(TrustEvaluation, DeliversManifestPropertiesThenObjectInEncodingOrder) {
  ASSERT_EQ(0, Evaluate(DefaultManifest()));
  const std::vector<Delivered> expected = {
      {Qor4Code("BNCH"), 0, DERTagOctetString}, {Qor4Code("BORD"), 0, DERTagInteger},
      {Qor4Code("CHIP"), 0, DERTagInteger},     {Qor4Code("CPRO"), 0, DERTagBoolean},
      {Qor4Code("CSEC"), 0, DERTagBoolean},     {Qor4Code("ECID"), 0, DERTagInteger},
      {Qor4Code("SDOM"), 0, DERTagInteger},     {Qor4Code("DGST"), 1, DERTagOctetString},
      {Qor4Code("pdnm"), 1, DERTagIA5String},   {Qor4Code("EKEY"), 1, DERTagBoolean}};
  EXPECT_EQ(expected, g_slots.delivered);
  EXPECT_TRUE(context_.manifestHashValid);

  // The signature is checked over the digest of the body, not of the whole manifest.
  uint8_t bodyDigest[48];
  FakeDigest(context_.manifest.body.data, context_.manifest.body.length, bodyDigest, 48);
  EXPECT_EQ(0, std::memcmp(bodyDigest, g_slots.signedDigest, 48));
}

// Skipping the chain leaves no constraints: evaluating them anyway would fail.
TEST_F(TrustEvaluation, StoredManifestHashSkipsChecksButDeliversEverything) {
  const Bytes manifest = DefaultManifest();
  uint8_t accepted[48];
  FakeDigest(manifest.data(), static_cast<uint32_t>(manifest.size()), accepted, 48);
  g_slots.storedHash = accepted;
  ASSERT_EQ(0, Evaluate(manifest));
  EXPECT_EQ(0, g_slots.chainCalls + g_slots.signatureCalls);
  EXPECT_EQ(10u, g_slots.delivered.size());

  accepted[47] ^= 1;  // a different manifest was accepted before
  ASSERT_EQ(0, Evaluate(manifest));
  EXPECT_EQ(1, g_slots.chainCalls);
}

TEST_F(TrustEvaluation, FirstFailureIsTheResult) {
  static constexpr Qor4DigestInfo kTooLong = {49, nullptr, std::nullopt};
  Qor4SecureBootParams noChain = kFakeParams, longDigest = kFakeParams, refuseLeaf = kFakeParams;
  noChain.verifyChain = nullptr;
  longDigest.digestInfo = &kTooLong;
  refuseLeaf.evaluateCertificateProperties = [](Qor4DecodeContext*, void*) { return 42; };
  // `failingSlot` is made to answer 42; `stopWith` is the property callback's answer.
  const struct {
    const char* name; int SlotState::*failingSlot; int stopWith; uint32_t object;
    const Qor4SecureBootParams* params; int result, signatureCalls; size_t delivered;
  } cases[] = {
      {"digest", &SlotState::digestResult, 0, kPdmg, &kFakeParams, 42, 0, 0},
      {"chain", &SlotState::chainResult, 0, kPdmg, &kFakeParams, 42, 0, 0},
      {"signature", &SlotState::signatureResult, 0, kPdmg, &kFakeParams, 42, 1, 0},
      {"certificate", nullptr, 0, kPdmg, &refuseLeaf, 42, 1, 0},
      {"property callback", nullptr, -7, kPdmg, &kFakeParams, -7, 1, 1},
      {"missing object", nullptr, 0, Qor4Code("none"), &kFakeParams, DERResultEndOfSequence, 1, 0},
      {"no chain slot", nullptr, 0, kPdmg, &noChain, DERResultParamError, 0, 0},
      {"digest longer than 48", nullptr, 0, kPdmg, &longDigest, DERResultOverflow, 0, 0},
  };
  for (const auto& c : cases) {
    g_slots = SlotState{};
    if (c.failingSlot) g_slots.*c.failingSlot = 42;
    g_slots.stopWith = c.stopWith;
    EXPECT_EQ(c.result, Evaluate(DefaultManifest(), c.object, *c.params)) << c.name;
    EXPECT_EQ(c.signatureCalls, g_slots.signatureCalls) << c.name;
    EXPECT_EQ(c.delivered, g_slots.delivered.size()) << c.name;
  }
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

// The leaf certificate's constraints: a SET of groups, each pinning manifest ("MANP") or
// object ("OBJP") properties to a value, or to being present or optional.
TEST_F(TrustEvaluation, CertificateConstraints) {
  auto manp = [](const std::vector<Bytes>& pins) { return Dictionary("MANP", pins); };
  auto presence = [](const char* code, uint64_t optional) {
    return Property(code, Constructed(ContextTag(optional, true), {}));
  };
  const Bytes bordMatches = manp({IntegerProperty("BORD", 0x10)});
  // Each row's constraints are the extension value.
  const struct { const char* name; Bytes constraints; int result; } cases[] = {
      {"NoExtension", {}, DERResultDecodeError},
      {"NotASet", Sequence({}), DERResultUnexpectedTag},
      {"ValueEqual", Set({bordMatches}), 0},
      {"PinnedValueMissing", Set({manp({IntegerProperty("XTRA", 1)})}), DERResultEndOfSequence},
      {"SecondGroupDiffers", Set({bordMatches, Dictionary("OBJP", {BooleanProperty("EKEY", false)})}), -1},
      {"RequiredPresent", Set({manp({presence("BNCH", 0)})}), 0},
      {"RequiredMissing", Set({manp({presence("XTRA", 0)})}), DERResultEndOfSequence},
      {"OptionalMissing", Set({manp({presence("XTRA", 1)})}), 0},
      {"UnknownValueTag", Set({manp({StringProperty("BNCH", "x")})}), DERResultUnexpectedTag},
      {"UnknownGroup", Set({Dictionary("ABCD", {})}), DERResultUnexpectedTag},
      {"GroupValueNotSet", Set({Property("MANP", Integer(1))}), DERResultUnexpectedTag},
      {"UndecodableTailEndsTheList",
       Element(kTagSet, Concat({bordMatches, Bytes{0x04}, manp({IntegerProperty("BORD", 0x11)})})), 0},
  };
  for (const auto& c : cases) {
    g_slots = SlotState{};
    g_slots.certificateProperties = c.constraints;
    EXPECT_EQ(c.result, Evaluate(DefaultManifest())) << c.name;
  }
}

TEST_F(TrustEvaluation, DecodeAndFullEvaluationAllocateNothing) {
  g_slots.certificateProperties = Set({Dictionary("MANP", {IntegerProperty("BORD", 0x10)}),
                                       Dictionary("OBJP", {BooleanProperty("EKEY", true)})});
  g_slots.delivered.reserve(16);  // recording must not allocate either
  const Bytes container = DefaultContainer();
  const Qor4PropertyCallbacks callbacks = {Record, nullptr};
  uint32_t type;

  g_allocations = 0;
  g_counting = true;
  const int init = InitContainer(container, &context_);
  const int evaluation =
      Qor4DecodePerformTrustEvaluatationWithCallbacks(kPdmg, &context_, &callbacks, &kFakeParams, &g_slots);
  const int getter = Qor4DecodeGetPayloadType(&context_, &type);
  g_counting = false;

  EXPECT_EQ(0, init);
  EXPECT_EQ(0, evaluation);
  EXPECT_EQ(0, getter);
  EXPECT_EQ(10u, g_slots.delivered.size());
  EXPECT_EQ(0, g_allocations);

  // The counter itself works. A direct call, because a new-expression whose result is
  // unused may be elided (clang does).
  g_counting = true;
  ::operator delete(::operator new(1));
  g_counting = false;
  EXPECT_GE(g_allocations, 1);
}

}  // namespace
}  // namespace brisvale
