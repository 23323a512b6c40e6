// Element decoding, iteration and table-driven parsing.
#include <cstring>

#include "verify/der/der.h"

namespace brisvale {

namespace {

constexpr uint8_t kHighTagNumberForm = 0x1F;
constexpr unsigned kMaxLengthOctets = 4;

// The universal, constructed SEQUENCE and SET differ only in the lowest tag bit.
bool IsSequenceOrSet(DERTag tag) { return (tag & ~DERTag{1}) == DERTagSequence; }

}  // namespace

DERResult DERDecodeItemPartialBuffer(const DERItem* der, DERDecodedItem* decoded, bool partial) {
  if (der == nullptr || decoded == nullptr) return DERResultParamError;
  if (der->data == nullptr || der->length < 2) return DERResultDecodeError;

  const uint8_t* cursor = der->data;
  uint32_t remaining = der->length;
  const uint8_t first = *cursor++;
  remaining--;

  uint64_t tagNumber = first & kHighTagNumberForm;
  if (tagNumber == kHighTagNumberForm) {
    // Minimal high-tag form: no leading 0x80 octet and no number a single octet holds.
    if (*cursor == 0x80 || *cursor < kHighTagNumberForm) return DERResultDecodeError;
    uint64_t accumulator = 0;
    uint8_t octet;
    do {
      if ((accumulator >> 57) != 0 || remaining < 2) return DERResultDecodeError;
      octet = *cursor++;
      remaining--;
      accumulator = (accumulator << 7) | (octet & 0x7F);
    } while (octet & 0x80);
    if ((accumulator >> 61) != 0) return DERResultDecodeError;
    tagNumber = accumulator;
  }
  const DERTag tag = tagNumber | (static_cast<DERTag>(first & 0xE0) << 56);

  const uint8_t lengthOctet = *cursor++;
  remaining--;
  uint32_t length;
  if ((lengthOctet & 0x80) == 0) {
    length = lengthOctet;
    if (length > remaining && !partial) return DERResultDecodeError;
  } else {
    const unsigned count = lengthOctet & 0x7F;
    if (count > remaining || count == 0 || count > kMaxLengthOctets) return DERResultDecodeError;
    if (cursor[0] == 0) return DERResultDecodeError;
    length = 0;
    for (unsigned i = 0; i < count; i++) length = (length << 8) | *cursor++;
    remaining -= count;
    if (length > remaining && !partial) return DERResultDecodeError;
  }

  decoded->tag = tag;
  decoded->content = {cursor, length};
  return DERResultSuccess;
}

DERResult DERDecodeItem(const DERItem* der, DERDecodedItem* decoded) {
  return DERDecodeItemPartialBuffer(der, decoded, false);
}

DERResult DERDecodeSeqInit(const DERItem* der, DERTag* tag, DERSequence* sequence) {
  if (tag == nullptr || sequence == nullptr) return DERResultParamError;
  DERDecodedItem item;
  const DERResult result = DERDecodeItem(der, &item);
  if (result != DERResultSuccess) return result;
  *tag = item.tag;
  if (!IsSequenceOrSet(item.tag)) return DERResultUnexpectedTag;
  sequence->next = item.content.data;
  sequence->end = item.content.data + item.content.length;
  return DERResultSuccess;
}

DERResult DERDecodeSeqContentInit(const DERItem* content, DERSequence* sequence) {
  if (content == nullptr || sequence == nullptr) return DERResultParamError;
  sequence->next = content->data;
  sequence->end = content->data + content->length;
  return DERResultSuccess;
}

DERResult DERDecodeSeqNext(DERSequence* sequence, DERDecodedItem* decoded) {
  if (sequence == nullptr || decoded == nullptr) return DERResultParamError;
  if (sequence->next >= sequence->end) return DERResultEndOfSequence;
  const DERItem rest = {sequence->next, static_cast<uint32_t>(sequence->end - sequence->next)};
  const DERResult result = DERDecodeItem(&rest, decoded);
  if (result != DERResultSuccess) return result;
  sequence->next = decoded->content.data + decoded->content.length;
  return DERResultSuccess;
}

DERResult DERParseSequence(const DERItem* der, uint16_t numSpecs, const DERItemSpec* specs,
                           void* destination, uint32_t sizeToClear) {
  DERDecodedItem item;
  const DERResult result = DERDecodeItem(der, &item);
  if (result != DERResultSuccess) return result;
  if (item.tag != DERTagSequence) return DERResultUnexpectedTag;
  return DERParseSequenceContent(&item.content, numSpecs, specs, destination, sizeToClear);
}

DERResult DERParseSequenceContent(const DERItem* content, uint16_t numSpecs,
                                  const DERItemSpec* specs, void* destination,
                                  uint32_t sizeToClear) {
  if (content == nullptr || (numSpecs != 0 && specs == nullptr) ||
      ((numSpecs != 0 || sizeToClear != 0) && destination == nullptr)) {
    return DERResultParamError;
  }
  auto* record = static_cast<uint8_t*>(destination);
  if (sizeToClear != 0) std::memset(record, 0, sizeToClear);
  if (numSpecs == 0) return content->length == 0 ? DERResultSuccess : DERResultDecodeError;

  DERSequence sequence;
  DERDecodeSeqContentInit(content, &sequence);
  uint16_t row = 0;
  while (true) {
    const uint8_t* elementStart = sequence.next;
    DERDecodedItem element;
    const DERResult result = DERDecodeSeqNext(&sequence, &element);
    if (result == DERResultEndOfSequence) break;
    if (result != DERResultSuccess) return result;

    while (true) {
      if (row >= numSpecs) return DERResultUnexpectedTag;
      const DERItemSpec& spec = specs[row];
      if ((spec.options & DERItemAnyTag) != 0 || spec.tag == element.tag) break;
      if ((spec.options & DERItemOptional) == 0) return DERResultUnexpectedTag;
      row++;
    }

    const DERItemSpec& spec = specs[row];
    if ((spec.options & DERItemSkip) == 0) {
      DERItem stored = element.content;
      if ((spec.options & DERItemSaveEncoding) != 0) {
        const uint8_t* elementEnd = element.content.data + element.content.length;
        stored = {elementStart, static_cast<uint32_t>(elementEnd - elementStart)};
      }
      std::memcpy(record + spec.offset, &stored, sizeof stored);
    }
    row++;
    if (row == numSpecs) {
      return sequence.next >= sequence.end ? DERResultSuccess : DERResultDecodeError;
    }
  }

  for (; row < numSpecs; row++) {
    if ((specs[row].options & DERItemOptional) == 0) return DERResultIncompleteSequence;
  }
  return DERResultSuccess;
}

}  // namespace brisvale
