// Conversion of primitive contents: INTEGER, BOOLEAN, BIT STRING, byte-wise comparison.
#include <cstring>

#include "verify/der/der.h"

namespace brisvale {

DERResult DERParseInteger64(const DERItem* content, uint64_t* value) {
  if (content == nullptr || value == nullptr) return DERResultParamError;
  const uint32_t length = content->length;
  if (length == 0 || content->data == nullptr) return DERResultDecodeError;
  const uint8_t* bytes = content->data;
  if ((bytes[0] & 0x80) != 0) return DERResultDecodeError;  // negative
  if (bytes[0] != 0) {
    if (length > 8) return DERResultOverflow;
  } else if (length >= 2) {
    if ((bytes[1] & 0x80) == 0) return DERResultDecodeError;  // redundant leading zero
    if (length > 9) return DERResultOverflow;
  }
  uint64_t result = 0;
  for (uint32_t i = 0; i < length; i++) result = (result << 8) | bytes[i];
  *value = result;
  return DERResultSuccess;
}

DERResult DERParseInteger(const DERItem* content, uint32_t* value) {
  if (value == nullptr) return DERResultParamError;
  uint64_t wide;
  const DERResult result = DERParseInteger64(content, &wide);
  if (result != DERResultSuccess) return result;
  if (wide > UINT32_MAX) return DERResultOverflow;
  *value = static_cast<uint32_t>(wide);
  return DERResultSuccess;
}

DERResult DERParseBoolean(const DERItem* content, bool* value) {
  if (content == nullptr || value == nullptr) return DERResultParamError;
  if (content->length != 1 || content->data == nullptr) return DERResultDecodeError;
  const uint8_t octet = content->data[0];
  if (octet != 0x00 && octet != 0xFF) return DERResultDecodeError;
  *value = octet != 0;
  return DERResultSuccess;
}

DERResult DERParseBooleanWithDefault(const DERItem* content, bool defaultValue, bool* value) {
  if (content == nullptr || value == nullptr) return DERResultParamError;
  if (content->length == 0) {
    *value = defaultValue;
    return DERResultSuccess;
  }
  return DERParseBoolean(content, value);
}

DERResult DERParseBitString(const DERItem* content, DERItem* bits, uint8_t* unusedBits) {
  if (content == nullptr || bits == nullptr || unusedBits == nullptr) return DERResultParamError;
  if (content->length >= 2) {
    *unusedBits = content->data[0];
    *bits = {content->data + 1, content->length - 1};
  } else {
    *unusedBits = 0;
    *bits = {nullptr, 0};
  }
  return DERResultSuccess;
}

bool DEROidCompare(const DERItem* first, const DERItem* second) {
  if (first == nullptr || second == nullptr) return false;
  if (first->length != second->length) return false;
  if (first->length == 0) return true;
  return std::memcmp(first->data, second->data, first->length) == 0;
}

}  // namespace brisvale
