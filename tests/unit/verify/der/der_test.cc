// The DER reader against hand-made encodings: element decoding, sequence walking,
// table-driven parsing, and INTEGER, BOOLEAN and BIT STRING contents.
#include <gtest/gtest.h>

#include <cstddef>
#include <cstring>
#include <vector>

#include "derwriter/der_writer.h"
#include "verify/der/der.h"

namespace brisvale {
namespace {

using derwriter::Bytes;

DERItem ItemOf(const Bytes& bytes) { return {bytes.data(), static_cast<uint32_t>(bytes.size())}; }

// One row per rule of the identifier and length octets, at its boundary.
TEST(DerDecodeItem, ResultTagAndLength) {
  constexpr uint64_t kLargestTag = (uint64_t{1} << 61) - 1;
  struct Case {
    const char* name; Bytes input; DERResult result;
    DERTag tag = 0; uint32_t length = 0; bool partial = false;
  } cases[] = {
      {"ContextConstructed", {0xA3, 0x01, 0x05}, DERResultSuccess, DERTagContextSpecificConstructed(3), 1},
      {"OneByte", {0x30}, DERResultDecodeError},
      {"PrivateFourCharacterCode", {0xFF, 0x84, 0xEA, 0x85, 0x9C, 0x42, 0x00}, DERResultSuccess,
       DERTagPrivateConstructed(0x4D414E42), 0},
      {"HighFormTag31", {0x1F, 0x1F, 0x00}, DERResultSuccess, 31, 0},
      {"HighFormForLowTag", {0x1F, 0x1E, 0x00}, DERResultDecodeError},
      {"HighFormLeading80", {0x1F, 0x80, 0x01, 0x00}, DERResultDecodeError},
      {"HighFormNoLengthOctet", {0x1F, 0x81, 0x01}, DERResultDecodeError},
      // 2^61 - 1 and 2^61 in nine base-128 digits.
      {"TagNumberLargest", {0x1F, 0x9F, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0x7F, 0x00},
       DERResultSuccess, kLargestTag, 0},
      {"TagNumber2To61", {0x1F, 0xA0, 0x80, 0x80, 0x80, 0x80, 0x80, 0x80, 0x80, 0x00, 0x00},
       DERResultDecodeError},
      {"TagNumberTenDigits", {0x1F, 0x81, 0x80, 0x80, 0x80, 0x80, 0x80, 0x80, 0x80, 0x80, 0x00, 0x00},
       DERResultDecodeError},
      {"Indefinite", {0x30, 0x80, 0x00, 0x00}, DERResultDecodeError},
      {"FiveLengthOctets", {0x04, 0x85, 0x01, 0x00, 0x00, 0x00, 0x00}, DERResultDecodeError},
      {"LeadingZeroLengthOctet", {0x04, 0x82, 0x00, 0x05, 1, 2, 3, 4, 5}, DERResultDecodeError},
      {"LongFormForShortLength", {0x04, 0x81, 0x05, 1, 2, 3, 4, 5}, DERResultSuccess, DERTagOctetString, 5},
      {"ShortLengthPastEnd", {0x04, 0x03, 1, 2}, DERResultDecodeError},
      {"LongLengthPastEnd", {0x04, 0x81, 0x03, 1, 2}, DERResultDecodeError},
      {"PartialLargest", {0x04, 0x84, 0xFF, 0xFF, 0xFF, 0xFF}, DERResultSuccess, DERTagOctetString,
       0xFFFFFFFF, true},
      {"PartialStillNeedsLengthOctets", {0x04, 0x84, 0xFF, 0xFF}, DERResultDecodeError, 0, 0, true},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    const DERItem input = ItemOf(c.input);
    DERDecodedItem decoded{};
    EXPECT_EQ(c.result, DERDecodeItemPartialBuffer(&input, &decoded, c.partial));
    if (c.result != DERResultSuccess) continue;
    EXPECT_EQ(c.tag, decoded.tag);
    EXPECT_EQ(c.length, decoded.content.length);
    // Unless partial, the content ends inside the input.
    if (!c.partial) {
      EXPECT_EQ(c.input.data() + c.input.size(), decoded.content.data + c.length);
    }
  }
}

// Walking elements is exercised by every container and chain test.
TEST(DerSequence, InitTakesSequenceOrSetOnly) {
  const Bytes set = {0x31, 0x00};
  const Bytes contextSixteen = {0xB0, 0x00};  // [16] constructed: the SEQUENCE number, wrong class
  const DERItem setItem = ItemOf(set), contextItem = ItemOf(contextSixteen);
  DERTag tag = 0;
  DERSequence sequence;
  EXPECT_EQ(DERResultSuccess, DERDecodeSeqInit(&setItem, &tag, &sequence));
  EXPECT_EQ(DERResultUnexpectedTag, DERDecodeSeqInit(&contextItem, &tag, &sequence));
}

// Rows: A INTEGER required, B BOOLEAN optional, C OCTET STRING required.
struct Abc {
  DERItem a, b, c;
};
const DERItemSpec kAbcSpecs[] = {
    {offsetof(Abc, a), DERTagInteger, 0},
    {offsetof(Abc, b), DERTagBoolean, DERItemOptional},
    {offsetof(Abc, c), DERTagOctetString, 0},
};
const Bytes kA = {0x02, 0x01, 0x01};
const Bytes kB = {0x01, 0x01, 0xFF};
const Bytes kC = {0x04, 0x02, 0xAA, 0xBB};
const Bytes kD = {0x05, 0x00};

TEST(DerTable, OptionalRequiredAndTrailingRules) {
  const struct { const char* name; std::vector<Bytes> elements; DERResult result; } cases[] = {
      {"AC", {kA, kC}, DERResultSuccess},
      {"ABC", {kA, kB, kC}, DERResultSuccess},
      {"AB", {kA, kB}, DERResultIncompleteSequence},
      {"ACD", {kA, kC, kD}, DERResultDecodeError},
      {"C", {kC}, DERResultUnexpectedTag},
      {"AMalformed", {kA, {0x04}}, DERResultDecodeError},
  };
  static const uint8_t kSentinel[1] = {0x5A};
  for (const auto& c : cases) {
    const Bytes content = derwriter::Concat(c.elements);
    const DERItem item = ItemOf(content);
    Abc record = {{kSentinel, 1}, {kSentinel, 1}, {kSentinel, 1}};
    EXPECT_EQ(c.result, DERParseSequenceContent(&item, 3, kAbcSpecs, &record, 0)) << c.name;
    if (std::strcmp(c.name, "AC") == 0) {
      EXPECT_EQ(content.data() + 2, record.a.data);
      EXPECT_EQ(kSentinel, record.b.data);  // passed over: untouched
      EXPECT_EQ(2u, record.c.length);
    }
  }
}

TEST(DerTable, ClearsSavesEncodingsSkipsAndMatchesAnyTag) {
  struct Record {
    DERItem whole, any;
  } record;
  std::memset(&record, 0xEE, sizeof record);
  const DERItemSpec specs[] = {
      {offsetof(Record, whole), DERTagInteger, DERItemSaveEncoding},
      {0, DERTagBoolean, DERItemSkip},
      {offsetof(Record, any), 0, DERItemAnyTag | DERItemOptional},
  };
  const Bytes content = derwriter::Concat({kA, kB, kD});
  const DERItem item = ItemOf(content);
  ASSERT_EQ(DERResultSuccess, DERParseSequenceContent(&item, 3, specs, &record, sizeof record));
  EXPECT_EQ(content.data(), record.whole.data);
  EXPECT_EQ(3u, record.whole.length);
  EXPECT_EQ(content.data() + 8, record.any.data);

  // An absent optional row is zero because the cleared range covered it.
  const Bytes two = derwriter::Concat({kA, kB});
  const DERItem twoItem = ItemOf(two);
  ASSERT_EQ(DERResultSuccess, DERParseSequenceContent(&twoItem, 3, specs, &record, sizeof record));
  EXPECT_EQ(nullptr, record.any.data);
}

TEST(DerTable, ZeroRowsAndOuterElementRules) {
  const DERItem emptyItem = {nullptr, 0}, notEmpty = ItemOf(kA);
  EXPECT_EQ(DERResultSuccess, DERParseSequenceContent(&emptyItem, 0, nullptr, nullptr, 0));
  EXPECT_EQ(DERResultDecodeError, DERParseSequenceContent(&notEmpty, 0, nullptr, nullptr, 0));

  Abc record{};
  const Bytes sequence = derwriter::Concat({derwriter::Sequence({kA, kC}), Bytes{0xFF, 0xFF}});
  const DERItem sequenceItem = ItemOf(sequence);  // bytes after the element are ignored
  EXPECT_EQ(DERResultSuccess, DERParseSequence(&sequenceItem, 3, kAbcSpecs, &record, sizeof record));
  const Bytes set = derwriter::Set({kA, kC});
  const DERItem setItem = ItemOf(set);
  EXPECT_EQ(DERResultUnexpectedTag, DERParseSequence(&setItem, 3, kAbcSpecs, &record, sizeof record));
  EXPECT_EQ(DERResultParamError, DERParseSequence(&sequenceItem, 3, kAbcSpecs, nullptr, 0));
}

TEST(DerInteger, ConvertsWithinItsWidth) {
  // `wide`: DERParseInteger64, else DERParseInteger.
  const struct {
    const char* name; Bytes content; bool wide; DERResult result; uint64_t value = 0;
  } cases[] = {
      {"Empty", {}, true, DERResultDecodeError},
      {"RedundantZero", {0x00, 0x7F}, true, DERResultDecodeError},
      {"Negative", {0xFF}, true, DERResultDecodeError},
      {"NineOctetsTopBitSet", {0x00, 0x80, 0, 0, 0, 0, 0, 0, 0x01}, true, DERResultSuccess,
       0x8000000000000001ull},
      {"TenOctetsWithZero", {0x00, 0x80, 0, 0, 0, 0, 0, 0, 0, 0}, true, DERResultOverflow},
      {"EightOctets", {0x7F, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFE}, true, DERResultSuccess,
       0x7FFFFFFFFFFFFFFEull},
      {"NineOctets", {0x01, 0, 0, 0, 0, 0, 0, 0, 0}, true, DERResultOverflow},
      {"Largest32", {0x00, 0xFF, 0xFF, 0xFF, 0xFF}, false, DERResultSuccess, 0xFFFFFFFFu},
      {"TooLarge32", {0x01, 0x00, 0x00, 0x00, 0x00}, false, DERResultOverflow},
  };
  for (const auto& c : cases) {
    const DERItem item = ItemOf(c.content);
    uint64_t value = 0;
    uint32_t narrow = 0;
    EXPECT_EQ(c.result, c.wide ? DERParseInteger64(&item, &value) : DERParseInteger(&item, &narrow))
        << c.name;
    if (c.result == DERResultSuccess) {
      EXPECT_EQ(c.value, c.wide ? value : narrow) << c.name;
    }
  }
}

TEST(DerBoolean, StrictContentAndDefault) {
  // `withDefault`: DERParseBooleanWithDefault with a default of true, else DERParseBoolean.
  const struct { Bytes content; bool withDefault; DERResult result; bool value; } cases[] = {
      {{0xFF}, false, DERResultSuccess, true},
      {{0x00}, false, DERResultSuccess, false},
      {{0x01}, false, DERResultDecodeError, false},
      {{0xFF, 0xFF}, false, DERResultDecodeError, false},
      {{}, true, DERResultSuccess, true},
      {{0x00, 0x00}, true, DERResultDecodeError, false},
  };
  for (const auto& c : cases) {
    const DERItem item = ItemOf(c.content);
    bool value = !c.value;
    EXPECT_EQ(c.result, c.withDefault ? DERParseBooleanWithDefault(&item, true, &value)
                                      : DERParseBoolean(&item, &value))
        << c.content.size();
    if (c.result == DERResultSuccess) {
      EXPECT_EQ(c.value, value);
    }
  }
}

// Bit strings with bits are read by every certificate key and signature in the chain tests.
TEST(DerBitStringAndCompare, EdgeCases) {
  const Bytes content = {0x03, 0xAB, 0xC0}, one = {0x00};
  const DERItem item = ItemOf(one);  // too short to hold bits: no bits, count 0
  DERItem bits;
  uint8_t unused = 0xFF;
  ASSERT_EQ(DERResultSuccess, DERParseBitString(&item, &bits, &unused));
  EXPECT_EQ(nullptr, bits.data);
  EXPECT_EQ(0, unused);

  const DERItem emptyOne = {nullptr, 0}, emptyTwo = {content.data(), 0}, prefix = {content.data(), 2};
  EXPECT_TRUE(DEROidCompare(&emptyOne, &emptyTwo));
  EXPECT_FALSE(DEROidCompare(&emptyOne, nullptr));
  EXPECT_FALSE(DEROidCompare(&item, &prefix));
}

}  // namespace
}  // namespace brisvale
