// Decoding of the container and its sections into the context, and container sizes
// from a prefix.
#include <cstring>

#include "verify/container/qor4.h"

namespace brisvale {

namespace {

bool IsAbsent(const DERItem& item) { return item.data == nullptr && item.length == 0; }

// Header plus content length of the first element of `item`; 0 when it does not decode.
uint32_t FirstElementSize(const DERItem& item) {
  DERDecodedItem decoded;
  if (DERDecodeItem(&item, &decoded) != DERResultSuccess) return 0;
  return static_cast<uint32_t>(decoded.content.data + decoded.content.length - item.data);
}

template <typename Record>
int ParseSection(const DERItem* item, const DERItemSpec* specs, uint32_t numSpecs,
                 Record* destination, uint32_t magic) {
  const DERResult result = DERParseSequence(item, static_cast<uint16_t>(numSpecs), specs,
                                            destination, sizeof(Record));
  if (result != DERResultSuccess) return result;
  if (DERQor4DecodeTagCompare(&destination->magic, magic) != 0) return DERResultUnexpectedTag;
  return DERResultSuccess;
}

}  // namespace

int DERQor4DecodeTagCompare(const DERItem* content, uint32_t code) {
  if (content == nullptr || content->length < 4) return -1;
  if (content->length > 4) return 1;
  uint32_t value;
  if (DERParseInteger(content, &value) != DERResultSuccess) return -2;
  if (value < code) return -1;
  return value > code ? 1 : 0;
}

int DERQor4Decode(const DERItem* item, DERQor4* destination) {
  if (item == nullptr || destination == nullptr) return DERResultParamError;
  return ParseSection(item, DERQor4ItemSpecs, DERNumQor4ItemSpecs, destination,
                      kQor4MagicContainer);
}

int DERQor4DecodePayload(const DERItem* item, DERQor4Payload* destination) {
  if (item == nullptr || destination == nullptr) return DERResultParamError;
  int result = ParseSection(item, DERQor4PayloadItemSpecs, DERNumQor4PayloadItemSpecs,
                            destination, kQor4MagicPayload);
  if (result != DERResultSuccess || destination->compression.data == nullptr) return result;

  DERQor4Compression compression;
  result = DERParseSequenceContent(&destination->compression,
                                   static_cast<uint16_t>(DERNumQor4CompressionItemSpecs),
                                   DERQor4CompressionItemSpecs, &compression, sizeof compression);
  if (result != DERResultSuccess) return result;
  uint32_t algorithm;
  uint32_t uncompressedSize;
  result = DERParseInteger(&compression.algorithm, &algorithm);
  if (result != DERResultSuccess) return result;
  if (algorithm > 1) return DERResultParamError;
  return DERParseInteger(&compression.uncompressedSize, &uncompressedSize);
}

int DERQor4DecodeManifest(const DERItem* item, DERQor4Manifest* destination) {
  if (item == nullptr || destination == nullptr) return DERResultParamError;
  if (IsAbsent(*item)) return DERResultSuccess;
  int result = ParseSection(item, DERQor4ManifestItemSpecs, DERNumQor4ManifestItemSpecs,
                            destination, kQor4MagicManifest);
  if (result != DERResultSuccess) return result;
  uint32_t version;
  result = DERParseInteger(&destination->version, &version);
  if (result != DERResultSuccess) return result;
  return version == 0 ? DERResultSuccess : DERResultUnexpectedTag;
}

int DERQor4DecodeRestoreInfo(const DERItem* item, DERQor4RestoreInfo* destination) {
  if (item == nullptr || IsAbsent(*item)) return DERResultSuccess;
  if (destination == nullptr) return DERResultParamError;
  return ParseSection(item, DERQor4RestoreInfoItemSpecs, DERNumQor4RestoreInfoItemSpecs,
                      destination, kQor4MagicRestoreInfo);
}

int Qor4DecodeInit(const uint8_t* bytes, uint32_t length, Qor4DecodeContext* context) {
  if (bytes == nullptr || context == nullptr) return DERResultParamError;
  std::memset(context, 0, sizeof *context);
  const DERItem input = {bytes, length};
  DERQor4 top;
  int result = DERQor4Decode(&input, &top);
  if (result != DERResultSuccess) return result;
  if (FirstElementSize(input) != length) return DERResultOverflow;

  result = DERQor4DecodePayload(&top.payload, &context->payload);
  if (result != DERResultSuccess) return result;
  context->payloadEncoding = top.payload;

  // The [0] and [1] wrappers must hold exactly their section, so that the manifest
  // encoding (and its digest) covers nothing else.
  if (!IsAbsent(top.manifest)) {
    result = DERQor4DecodeManifest(&top.manifest, &context->manifest);
    if (result != DERResultSuccess) return result;
    if (FirstElementSize(top.manifest) != top.manifest.length) return DERResultOverflow;
    context->manifestEncoding = top.manifest;
  }
  if (!IsAbsent(top.restoreInfo)) {
    result = DERQor4DecodeRestoreInfo(&top.restoreInfo, &context->restoreInfo);
    if (result != DERResultSuccess) return result;
    if (FirstElementSize(top.restoreInfo) != top.restoreInfo.length) return DERResultOverflow;
  }
  return DERResultSuccess;
}

int Qor4DecodeInitPayload(const uint8_t* bytes, uint32_t length, Qor4DecodeContext* context) {
  if (bytes == nullptr || context == nullptr) return DERResultParamError;
  std::memset(context, 0, sizeof *context);
  const DERItem input = {bytes, length};
  return DERQor4DecodePayload(&input, &context->payload);
}

int Qor4DecodeInitManifest(const uint8_t* bytes, uint32_t length, Qor4DecodeContext* context) {
  if (bytes == nullptr || context == nullptr) return DERResultParamError;
  const DERItem input = {bytes, length};
  const int result = DERQor4DecodeManifest(&input, &context->manifest);
  if (result != DERResultSuccess) return result;
  if (context->manifest.body.data == nullptr) return DERResultDecodeError;
  const uint32_t encodedSize = FirstElementSize(input);
  context->manifestEncoding = {bytes, encodedSize};
  return encodedSize == length ? DERResultSuccess : DERResultOverflow;
}

int Qor4DecodeParseLengthFromBufferWithTag(const uint8_t* bytes, uint32_t availableLength,
                                           uint32_t magic, uint32_t* totalLength) {
  if (bytes == nullptr || totalLength == nullptr) return -1;
  const DERItem prefix = {bytes, availableLength};
  DERDecodedItem outer;
  DERResult result = DERDecodeItemPartialBuffer(&prefix, &outer, true);
  if (result != DERResultSuccess) return result;
  if (outer.tag != DERTagSequence) return DERResultUnexpectedTag;

  // Only the part of the content inside the prefix may be read.
  const uint32_t headerLength = static_cast<uint32_t>(outer.content.data - bytes);
  const uint32_t contentInPrefix = availableLength - headerLength;
  const DERItem firstElement = {
      outer.content.data,
      outer.content.length < contentInPrefix ? outer.content.length : contentInPrefix};
  DERDecodedItem magicItem;
  result = DERDecodeItem(&firstElement, &magicItem);
  if (result != DERResultSuccess) return result;
  if (DERQor4DecodeTagCompare(&magicItem.content, magic) != 0) return DERResultUnexpectedTag;

  const uint64_t total = uint64_t{headerLength} + outer.content.length;
  if (total > UINT32_MAX) return DERResultOverflow;
  *totalLength = static_cast<uint32_t>(total);
  return DERResultSuccess;
}

int Qor4DecodeParseLengthFromBuffer(const uint8_t* bytes, uint32_t availableLength,
                                    uint32_t* totalLength) {
  return Qor4DecodeParseLengthFromBufferWithTag(bytes, availableLength, kQor4MagicContainer,
                                                totalLength);
}

}  // namespace brisvale
