// Allocation-free DER (X.690) decoding for the image-verification layers: one element
// at a time, iteration over constructed elements, table-driven filling of records, and
// conversion of INTEGER, BOOLEAN and BIT STRING contents. Every result points into the
// caller's buffer; nothing here allocates, copies, logs or keeps state between calls.
#pragma once

#include <cstdint>

namespace brisvale {

// A byte range inside a caller's buffer. {nullptr, 0} means "absent".
struct DERItem {
  const uint8_t* data;
  uint32_t length;
};

// Bits 63-62: class; bit 61: constructed; bits 60-0: tag number.
using DERTag = uint64_t;

inline constexpr DERTag DERTagClassMask = 0xC000000000000000ull;
inline constexpr DERTag DERTagClassUniversal = 0x0000000000000000ull;
inline constexpr DERTag DERTagClassApplication = 0x4000000000000000ull;
inline constexpr DERTag DERTagClassContextSpecific = 0x8000000000000000ull;
inline constexpr DERTag DERTagClassPrivate = 0xC000000000000000ull;
inline constexpr DERTag DERTagConstructed = 0x2000000000000000ull;
inline constexpr DERTag DERTagNumberMask = 0x1FFFFFFFFFFFFFFFull;

inline constexpr DERTag DERTagBoolean = 0x01;
inline constexpr DERTag DERTagInteger = 0x02;
inline constexpr DERTag DERTagBitString = 0x03;
inline constexpr DERTag DERTagOctetString = 0x04;
inline constexpr DERTag DERTagNull = 0x05;
inline constexpr DERTag DERTagOid = 0x06;
inline constexpr DERTag DERTagUTF8String = 0x0C;
inline constexpr DERTag DERTagPrintableString = 0x13;
inline constexpr DERTag DERTagIA5String = 0x16;
inline constexpr DERTag DERTagUTCTime = 0x17;
inline constexpr DERTag DERTagGeneralizedTime = 0x18;
inline constexpr DERTag DERTagSequence = DERTagConstructed | 0x10;
inline constexpr DERTag DERTagSet = DERTagConstructed | 0x11;

constexpr DERTag DERTagContextSpecific(uint64_t number) {
  return DERTagClassContextSpecific | number;
}
constexpr DERTag DERTagContextSpecificConstructed(uint64_t number) {
  return DERTagClassContextSpecific | DERTagConstructed | number;
}
constexpr DERTag DERTagPrivateConstructed(uint64_t number) {
  return DERTagClassPrivate | DERTagConstructed | number;
}

// Shared by the DER and signed-container layers.
enum DERResult : uint32_t {
  DERResultSuccess = 0,
  DERResultEndOfSequence = 1,  // iterator exhausted; also "not found"
  DERResultUnexpectedTag = 2,  // wrong tag, or a structural rule broken
  DERResultDecodeError = 3,    // malformed encoding or content
  DERResultIncompleteSequence = 5,
  DERResultParamError = 6,  // null required pointer, or value out of range
  DERResultOverflow = 7,    // number too big for its destination, or lengths disagree
};

struct DERDecodedItem {
  DERTag tag;
  DERItem content;  // content octets only
};

// Position inside a constructed element's content; finished when next >= end.
struct DERSequence {
  const uint8_t* next;
  const uint8_t* end;
};

// One row of an item-spec table: where in the destination record the element's DERItem
// goes, which tag it must have, and how it is treated.
struct DERItemSpec {
  uint32_t offset;
  DERTag tag;
  uint16_t options;
};

inline constexpr uint16_t DERItemOptional = 0x1;
inline constexpr uint16_t DERItemAnyTag = 0x2;
inline constexpr uint16_t DERItemSkip = 0x4;
inline constexpr uint16_t DERItemSaveEncoding = 0x8;
// Marks the rows of RSA key tables; parsing ignores it.
inline constexpr uint16_t DERItemRsaKeyMarker = 0x100;

// Decodes the first element of `der`; its content must lie inside `der`.
DERResult DERDecodeItem(const DERItem* der, DERDecodedItem* decoded);

// As DERDecodeItem; with `partial` set, the content may extend past the end of `der`
// (used to learn an element's total size from a prefix). Such a content range must not
// be read.
DERResult DERDecodeItemPartialBuffer(const DERItem* der, DERDecodedItem* decoded, bool partial);

// Decodes a constructed SEQUENCE or SET and aims `sequence` at its content. `tag` is
// written even when it is refused.
DERResult DERDecodeSeqInit(const DERItem* der, DERTag* tag, DERSequence* sequence);

// Aims `sequence` at content that is already the inside of a constructed element.
DERResult DERDecodeSeqContentInit(const DERItem* content, DERSequence* sequence);

// Decodes the next element and advances; DERResultEndOfSequence when finished. On
// failure the iterator is left where it was.
DERResult DERDecodeSeqNext(DERSequence* sequence, DERDecodedItem* decoded);

// Decodes `der` as a constructed SEQUENCE (bytes after it are not examined) and fills
// `destination` from its elements by the table. The first `sizeToClear` bytes of the
// destination are zeroed first.
DERResult DERParseSequence(const DERItem* der, uint16_t numSpecs, const DERItemSpec* specs,
                           void* destination, uint32_t sizeToClear);

// As DERParseSequence for content already inside a SEQUENCE or SET.
DERResult DERParseSequenceContent(const DERItem* content, uint16_t numSpecs,
                                  const DERItemSpec* specs, void* destination,
                                  uint32_t sizeToClear);

// Non-negative INTEGER contents.
DERResult DERParseInteger(const DERItem* content, uint32_t* value);
DERResult DERParseInteger64(const DERItem* content, uint64_t* value);

DERResult DERParseBoolean(const DERItem* content, bool* value);
// An empty content yields `defaultValue`.
DERResult DERParseBooleanWithDefault(const DERItem* content, bool defaultValue, bool* value);

// Splits BIT STRING content into the unused-bit count and the bit bytes. The count is
// not range-checked; callers that need whole bytes require it to be 0.
DERResult DERParseBitString(const DERItem* content, DERItem* bits, uint8_t* unusedBits);

// True when both are non-null with equal length and bytes (any two items, not only OIDs).
bool DEROidCompare(const DERItem* first, const DERItem* second);

}  // namespace brisvale
