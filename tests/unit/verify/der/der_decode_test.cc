// Element decoding, iteration and table-driven parsing against hand-made encodings.
#include <gtest/gtest.h>

#include <cstddef>
#include <cstring>
#include <string>
#include <vector>

#include "derwriter/der_writer.h"
#include "verify/der/der.h"

namespace brisvale {
namespace {

using Bytes = std::vector<uint8_t>;

DERItem ItemOf(const Bytes& bytes) { return {bytes.data(), static_cast<uint32_t>(bytes.size())}; }

Bytes WithZeros(Bytes head, size_t zeros) {
  head.insert(head.end(), zeros, 0);
  return head;
}

struct DecodeCase {
  std::string name;
  Bytes input;
  bool partial;
  DERResult result;
  DERTag tag = 0;
  uint32_t length = 0;
};

class DecodeItem : public testing::TestWithParam<DecodeCase> {};

TEST_P(DecodeItem, ResultTagAndLength) {
  const DecodeCase& c = GetParam();
  const DERItem input = ItemOf(c.input);
  DERDecodedItem decoded{};
  ASSERT_EQ(c.result, DERDecodeItemPartialBuffer(&input, &decoded, c.partial));
  if (c.result != DERResultSuccess) return;
  EXPECT_EQ(c.tag, decoded.tag);
  EXPECT_EQ(c.length, decoded.content.length);
  // Unless partial, the content ends inside the input.
  if (!c.partial) {
    EXPECT_EQ(c.input.data() + c.input.size(), decoded.content.data + c.length);
  }
}

// A universal primitive identifier in the high-tag form, then an empty length.
Bytes HighTag(uint64_t number) {
  Bytes digits;
  for (; number != 0; number >>= 7) digits.insert(digits.begin(), 0x80 | (number & 0x7F));
  digits.back() &= 0x7F;
  digits.insert(digits.begin(), 0x1F);
  digits.push_back(0x00);
  return digits;
}

INSTANTIATE_TEST_SUITE_P(
    Der, DecodeItem,
    testing::Values(
        DecodeCase{"EmptySequence", {0x30, 0x00}, false, DERResultSuccess, DERTagSequence, 0},
        DecodeCase{"OneByte", {0x30}, false, DERResultDecodeError},
        DecodeCase{"Empty", {}, false, DERResultDecodeError},
        DecodeCase{"ContextConstructed", {0xA3, 0x01, 0x05}, false, DERResultSuccess,
                   DERTagContextSpecificConstructed(3), 1},
        DecodeCase{"PrivateFourCharacterCode", {0xFF, 0x84, 0xEA, 0x85, 0x9C, 0x42, 0x00}, false,
                   DERResultSuccess, DERTagPrivateConstructed(0x4D414E42), 0},
        DecodeCase{"HighFormTag31", {0x1F, 0x1F, 0x00}, false, DERResultSuccess, 31, 0},
        DecodeCase{"HighFormForLowTag", {0x1F, 0x1E, 0x00}, false, DERResultDecodeError},
        DecodeCase{"HighFormLeading80", {0x1F, 0x80, 0x01, 0x00}, false, DERResultDecodeError},
        DecodeCase{"HighFormNoLengthOctet", {0x1F, 0x81, 0x01}, false, DERResultDecodeError},
        DecodeCase{"HighFormUnterminated", {0x1F, 0x81, 0x81}, false, DERResultDecodeError},
        DecodeCase{"TagNumberLargest", HighTag((uint64_t{1} << 61) - 1), false, DERResultSuccess,
                   (uint64_t{1} << 61) - 1, 0},
        DecodeCase{"TagNumber2To61", HighTag(uint64_t{1} << 61), false, DERResultDecodeError},
        DecodeCase{"TagNumberTenDigits", {0x1F, 0x81, 0x80, 0x80, 0x80, 0x80, 0x80, 0x80, 0x80,
                                          0x80, 0x00, 0x00}, false, DERResultDecodeError},
        DecodeCase{"Indefinite", {0x30, 0x80, 0x00, 0x00}, false, DERResultDecodeError},
        DecodeCase{"FiveLengthOctets", {0x04, 0x85, 0x01, 0x00, 0x00, 0x00, 0x00}, false,
                   DERResultDecodeError},
        DecodeCase{"LeadingZeroLengthOctet", {0x04, 0x82, 0x00, 0x05, 1, 2, 3, 4, 5}, false,
                   DERResultDecodeError},
        DecodeCase{"LongFormForShortLength", {0x04, 0x81, 0x05, 1, 2, 3, 4, 5}, false,
                   DERResultSuccess, DERTagOctetString, 5},
        DecodeCase{"LengthOctetsMissing", {0x04, 0x82, 0x01}, false, DERResultDecodeError},
        DecodeCase{"ShortLengthPastEnd", {0x04, 0x03, 1, 2}, false, DERResultDecodeError},
        DecodeCase{"LongLengthPastEnd", {0x04, 0x81, 0x03, 1, 2}, false, DERResultDecodeError},
        DecodeCase{"PartialPrefix", WithZeros({0x30, 0x82, 0x10, 0x00}, 10), true,
                   DERResultSuccess, DERTagSequence, 4096},
        DecodeCase{"PrefixWithoutPartial", WithZeros({0x30, 0x82, 0x10, 0x00}, 10), false,
                   DERResultDecodeError},
        DecodeCase{"PartialLargest", {0x04, 0x84, 0xFF, 0xFF, 0xFF, 0xFF}, true, DERResultSuccess,
                   DERTagOctetString, 0xFFFFFFFF},
        DecodeCase{"PartialStillNeedsLengthOctets", {0x04, 0x84, 0xFF, 0xFF}, true,
                   DERResultDecodeError}),
    [](const testing::TestParamInfo<DecodeCase>& info) { return info.param.name; });

TEST(DerSequence, InitAcceptsSequenceAndSetOnly) {
  const Bytes set = {0x31, 0x03, 0x02, 0x01, 0x07};
  const Bytes contextSixteen = {0xB0, 0x00};  // [16] constructed: same number, wrong class
  const Bytes primitiveSixteen = {0x10, 0x00};
  DERTag tag = 0;
  DERSequence sequence;

  DERItem input = ItemOf(set);
  ASSERT_EQ(DERResultSuccess, DERDecodeSeqInit(&input, &tag, &sequence));
  EXPECT_EQ(DERTagSet, tag);
  EXPECT_EQ(set.data() + 2, sequence.next);
  EXPECT_EQ(set.data() + set.size(), sequence.end);

  input = ItemOf(contextSixteen);
  EXPECT_EQ(DERResultUnexpectedTag, DERDecodeSeqInit(&input, &tag, &sequence));
  EXPECT_EQ(DERTagContextSpecificConstructed(16), tag);  // written before the refusal
  input = ItemOf(primitiveSixteen);
  EXPECT_EQ(DERResultUnexpectedTag, DERDecodeSeqInit(&input, &tag, &sequence));
}

TEST(DerSequence, NextWalksElementsAndStopsOnMalformedWithoutMoving) {
  const Bytes content = {0x02, 0x01, 0x05, 0x04, 0x00, 0x04, 0x05, 0x01};
  const DERItem item = ItemOf(content);
  DERSequence sequence;
  ASSERT_EQ(DERResultSuccess, DERDecodeSeqContentInit(&item, &sequence));
  DERDecodedItem element;
  ASSERT_EQ(DERResultSuccess, DERDecodeSeqNext(&sequence, &element));
  EXPECT_EQ(DERTagInteger, element.tag);
  ASSERT_EQ(DERResultSuccess, DERDecodeSeqNext(&sequence, &element));
  EXPECT_EQ(0u, element.content.length);
  const DERSequence before = sequence;
  EXPECT_EQ(DERResultDecodeError, DERDecodeSeqNext(&sequence, &element));
  EXPECT_EQ(before.next, sequence.next);

  const DERItem empty = {nullptr, 0};
  ASSERT_EQ(DERResultSuccess, DERDecodeSeqContentInit(&empty, &sequence));
  EXPECT_EQ(DERResultEndOfSequence, DERDecodeSeqNext(&sequence, &element));
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
const uint8_t kSentinel[1] = {0x5A};

struct TableCase {
  std::string name;
  std::vector<Bytes> elements;
  DERResult result;
};

class TableParse : public testing::TestWithParam<TableCase> {};

TEST_P(TableParse, OptionalRequiredAndTrailingRules) {
  const Bytes content = derwriter::Concat(GetParam().elements);
  const DERItem item = ItemOf(content);
  Abc record = {{kSentinel, 1}, {kSentinel, 1}, {kSentinel, 1}};
  EXPECT_EQ(GetParam().result, DERParseSequenceContent(&item, 3, kAbcSpecs, &record, 0));
  if (GetParam().name == "AC") {
    EXPECT_EQ(content.data() + 2, record.a.data);
    EXPECT_EQ(kSentinel, record.b.data);  // passed over: untouched
    EXPECT_EQ(2u, record.c.length);
  }
}

INSTANTIATE_TEST_SUITE_P(
    Der, TableParse,
    testing::Values(TableCase{"AC", {kA, kC}, DERResultSuccess},
                    TableCase{"ABC", {kA, kB, kC}, DERResultSuccess},
                    TableCase{"AB", {kA, kB}, DERResultIncompleteSequence},
                    TableCase{"A", {kA}, DERResultIncompleteSequence},
                    TableCase{"ACD", {kA, kC, kD}, DERResultDecodeError},
                    TableCase{"C", {kC}, DERResultUnexpectedTag},
                    TableCase{"AA", {kA, kA}, DERResultUnexpectedTag},
                    TableCase{"ACMalformedTail", {kA, kC, {0x04}}, DERResultDecodeError},
                    TableCase{"Empty", {}, DERResultIncompleteSequence}),
    [](const testing::TestParamInfo<TableCase>& info) { return info.param.name; });

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
  EXPECT_EQ(0u, record.any.length);
  EXPECT_EQ(content.data() + 8, record.any.data);

  // An absent optional row is zero because the cleared range covered it.
  const Bytes two = derwriter::Concat({kA, kB});
  const DERItem twoItem = ItemOf(two);
  ASSERT_EQ(DERResultSuccess, DERParseSequenceContent(&twoItem, 3, specs, &record, sizeof record));
  EXPECT_EQ(nullptr, record.any.data);
}

TEST(DerTable, ZeroRowsAndOuterElementRules) {
  const Bytes empty;
  const DERItem emptyItem = ItemOf(empty);
  EXPECT_EQ(DERResultSuccess, DERParseSequenceContent(&emptyItem, 0, nullptr, nullptr, 0));
  const DERItem notEmpty = ItemOf(kA);
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

}  // namespace
}  // namespace brisvale
