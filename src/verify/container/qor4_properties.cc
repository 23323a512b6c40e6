// Property lookup by four-character code, and the getters built on it.
#include "verify/container/qor4.h"

namespace brisvale {

namespace {

constexpr uint32_t kSetNumber = static_cast<uint32_t>(DERTagSet);
constexpr uint32_t kSetHigh = static_cast<uint32_t>(DERTagSet >> 32);

constexpr DERTag JoinTag(uint32_t number, uint32_t high) {
  return (DERTag{high} << 32) | number;
}
constexpr DERTag PropertyTag(uint32_t number, uint32_t high) {
  return JoinTag(number, high | kQor4PrivateConstructedHigh);
}
constexpr uint32_t TagNumber(DERTag tag) { return static_cast<uint32_t>(tag); }
constexpr uint32_t TagHigh(DERTag tag) { return static_cast<uint32_t>(tag >> 32); }

// Finds a property with a value of `valueTag` in a section and hands the value on.
template <typename Convert>
int SectionValue(const Qor4DecodeContext* context, uint32_t section, uint32_t tagNumber,
                 uint32_t tagHigh, DERTag valueTag, Convert convert) {
  Qor4Property property;
  const int result = Qor4DecodeGetPropertyFromSection(
      context, section, tagNumber, tagHigh, TagNumber(valueTag), TagHigh(valueTag), &property);
  if (result != DERResultSuccess) return result;
  return convert(property.value);
}

template <typename Convert>
int ObjectValue(const Qor4DecodeContext* context, uint32_t objectTagNumber, uint32_t objectTagHigh,
                uint32_t propertyTagNumber, uint32_t propertyTagHigh, DERTag valueTag,
                Convert convert) {
  Qor4Property property;
  const int result =
      Qor4DecodeGetObjectProperty(context, objectTagNumber, objectTagHigh, propertyTagNumber,
                                  propertyTagHigh, TagNumber(valueTag), TagHigh(valueTag), &property);
  if (result != DERResultSuccess) return result;
  return convert(property.value);
}

template <typename Convert>
int EncodedValue(const DERItem* encoding, uint32_t tagNumber, uint32_t tagHigh, DERTag valueTag,
                 Convert convert) {
  Qor4Property property;
  const int result = DERQor4DecodeProperty(encoding, tagNumber, tagHigh, &property);
  if (result != DERResultSuccess) return result;
  if (property.valueTag != valueTag) return DERResultUnexpectedTag;
  return convert(property.value);
}

auto ToBoolean(bool* out) {
  return [out](const DERItem& value) -> int { return DERParseBoolean(&value, out); };
}
auto ToInteger(uint32_t* out) {
  return [out](const DERItem& value) -> int { return DERParseInteger(&value, out); };
}
auto ToInteger64(uint64_t* out) {
  return [out](const DERItem& value) -> int { return DERParseInteger64(&value, out); };
}
auto ToItem(DERItem* out) {
  return [out](const DERItem& value) -> int {
    *out = value;
    return DERResultSuccess;
  };
}
auto ToBytes(const uint8_t** data, uint32_t* length) {
  return [data, length](const DERItem& value) -> int {
    *data = value.data;
    *length = value.length;
    return DERResultSuccess;
  };
}

}  // namespace

int DERQor4DecodeFindInSequence(const uint8_t* next, const uint8_t* end, uint32_t tagNumber,
                                uint32_t tagHigh, DERItem* content) {
  if (content == nullptr) return DERResultParamError;
  const DERTag wanted = JoinTag(tagNumber, tagHigh);
  DERSequence sequence = {next, end};
  DERDecodedItem element;
  while (true) {
    const DERResult result = DERDecodeSeqNext(&sequence, &element);
    if (result != DERResultSuccess) return result;
    if (element.tag == wanted) {
      *content = element.content;
      return DERResultSuccess;
    }
  }
}

int DERQor4DecodeContentFindItemWithTag(const DERItem* dictionary, uint32_t tagNumber,
                                        uint32_t tagHigh, DERItem* content) {
  if (dictionary == nullptr) return DERResultParamError;
  return DERQor4DecodeFindInSequence(dictionary->data, dictionary->data + dictionary->length,
                                     tagNumber, tagHigh, content);
}

int DERQor4DecodeProperty(const DERItem* encoding, uint32_t tagNumber, uint32_t tagHigh,
                          Qor4Property* property) {
  if (encoding == nullptr || property == nullptr) return DERResultParamError;
  DERTag tag;
  DERSequence sequence;
  DERResult result = DERDecodeSeqInit(encoding, &tag, &sequence);
  if (result != DERResultSuccess) return result;
  if (tag != DERTagSequence) return DERResultUnexpectedTag;

  DERDecodedItem name;
  DERDecodedItem value;
  result = DERDecodeSeqNext(&sequence, &name);
  if (result == DERResultSuccess) result = DERDecodeSeqNext(&sequence, &value);
  if (result == DERResultEndOfSequence) return DERResultIncompleteSequence;
  if (result != DERResultSuccess) return result;
  if (name.tag != DERTagIA5String) return DERResultUnexpectedTag;

  DERDecodedItem extra;
  result = DERDecodeSeqNext(&sequence, &extra);
  if (result == DERResultSuccess) return DERResultUnexpectedTag;
  if (result != DERResultEndOfSequence) return result;

  if ((tagHigh | kQor4PrivateConstructedHigh) != kQor4PrivateConstructedHigh) {
    return DERResultUnexpectedTag;
  }
  if (DERQor4DecodeTagCompare(&name.content, tagNumber) != 0) return DERResultUnexpectedTag;

  property->name = name.content;
  property->value = value.content;
  property->valueTag = value.tag;
  return DERResultSuccess;
}

int DERQor4DecodeFindProperty(const DERItem* dictionary, uint32_t tagNumber, uint32_t tagHigh,
                              uint32_t valueTagNumber, uint32_t valueTagHigh,
                              Qor4Property* property) {
  if (dictionary == nullptr || property == nullptr) return DERResultParamError;
  const DERTag tag = PropertyTag(tagNumber, tagHigh);
  DERItem encoding;
  int result = DERQor4DecodeContentFindItemWithTag(dictionary, TagNumber(tag), TagHigh(tag),
                                                   &encoding);
  if (result != DERResultSuccess) return result;
  Qor4Property found;
  result = DERQor4DecodeProperty(&encoding, tagNumber, tagHigh, &found);
  if (result != DERResultSuccess) return result;
  if (found.valueTag != JoinTag(valueTagNumber, valueTagHigh)) return DERResultUnexpectedTag;
  found.tag = tag;
  *property = found;
  return DERResultSuccess;
}

int DERQor4DecodeParseManifestProperties(const Qor4DecodeContext* context,
                                         DERItem* manifestBodyDictionary,
                                         DERItem* manifestProperties) {
  if (context == nullptr || (manifestBodyDictionary == nullptr && manifestProperties == nullptr)) {
    return DERResultParamError;
  }
  DERTag tag;
  DERSequence body;
  const DERResult decoded = DERDecodeSeqInit(&context->manifest.body, &tag, &body);
  if (decoded == DERResultUnexpectedTag || (decoded == DERResultSuccess && tag != DERTagSet)) {
    return -1;
  }
  if (decoded != DERResultSuccess) return decoded;

  const DERItem bodyContent = {body.next, static_cast<uint32_t>(body.end - body.next)};
  Qor4Property dictionary;
  int result = DERQor4DecodeFindProperty(&bodyContent, kQor4ManifestBody, 0, kSetNumber, kSetHigh,
                                         &dictionary);
  if (result != DERResultSuccess) return result;
  if (manifestBodyDictionary != nullptr) *manifestBodyDictionary = dictionary.value;
  if (manifestProperties == nullptr) return DERResultSuccess;

  Qor4Property properties;
  result = DERQor4DecodeFindProperty(&dictionary.value, kQor4ManifestProperties, 0, kSetNumber,
                                     kSetHigh, &properties);
  if (result != DERResultSuccess) return result;
  *manifestProperties = properties.value;
  return DERResultSuccess;
}

// --- Payload and manifest getters -------------------------------------------------------------

bool Qor4DecodePayloadExists(const Qor4DecodeContext* context) {
  return context != nullptr && context->payload.data.data != nullptr;
}

int Qor4DecodeGetPayload(const Qor4DecodeContext* context, DERItem* data) {
  if (context == nullptr || data == nullptr) return DERResultParamError;
  if (!Qor4DecodePayloadExists(context)) return DERResultEndOfSequence;
  *data = context->payload.data;
  return DERResultSuccess;
}

int Qor4DecodeGetPayloadType(const Qor4DecodeContext* context, uint32_t* type) {
  if (context == nullptr || type == nullptr) return DERResultParamError;
  if (!Qor4DecodePayloadExists(context)) return DERResultEndOfSequence;
  return DERParseInteger(&context->payload.type, type);
}

int Qor4DecodeGetPayloadVersion(const Qor4DecodeContext* context, DERItem* version) {
  if (context == nullptr || version == nullptr) return DERResultParamError;
  if (!Qor4DecodePayloadExists(context)) return DERResultEndOfSequence;
  *version = context->payload.version;
  return DERResultSuccess;
}

bool Qor4DecodePayloadKeybagExists(const Qor4DecodeContext* context) {
  return context != nullptr && context->payload.keybag.data != nullptr;
}

int Qor4DecodeGetPayloadKeybag(const Qor4DecodeContext* context, DERItem* keybag) {
  if (context == nullptr || keybag == nullptr) return DERResultParamError;
  if (!Qor4DecodePayloadExists(context)) return DERResultEndOfSequence;
  *keybag = context->payload.keybag;
  return DERResultSuccess;
}

bool Qor4DecodePayloadCompressionInfoExists(const Qor4DecodeContext* context) {
  return context != nullptr && context->payload.compression.data != nullptr;
}

int Qor4DecodeGetPayloadCompressionInfo(const Qor4DecodeContext* context, uint32_t* algorithm,
                                        uint32_t* uncompressedSize) {
  int result = DERResultSuccess;
  DERQor4Compression compression;
  if (context == nullptr || algorithm == nullptr || uncompressedSize == nullptr) {
    result = DERResultParamError;
  } else if (!Qor4DecodePayloadExists(context) ||
             !Qor4DecodePayloadCompressionInfoExists(context)) {
    result = DERResultEndOfSequence;
  } else {
    result = DERParseSequenceContent(&context->payload.compression,
                                     static_cast<uint16_t>(DERNumQor4CompressionItemSpecs),
                                     DERQor4CompressionItemSpecs, &compression, sizeof compression);
    if (result == DERResultSuccess) result = DERParseInteger(&compression.algorithm, algorithm);
    if (result == DERResultSuccess) {
      result = DERParseInteger(&compression.uncompressedSize, uncompressedSize);
    }
  }
  if (result != DERResultSuccess && algorithm != nullptr && uncompressedSize != nullptr) {
    *algorithm = UINT32_MAX;
    *uncompressedSize = UINT32_MAX;
  }
  return result;
}

bool Qor4DecodeManifestExists(const Qor4DecodeContext* context) {
  return context != nullptr && context->manifestEncoding.data != nullptr;
}

int Qor4DecodeGetManifest(const Qor4DecodeContext* context, const uint8_t** data,
                          uint32_t* length) {
  if (context == nullptr || data == nullptr || length == nullptr) return DERResultParamError;
  *data = context->manifestEncoding.data;
  *length = context->manifestEncoding.length;
  return (*data == nullptr || *length == 0) ? -1 : int{DERResultSuccess};
}

// --- Section getters ------------------------------------------------------------------------------

int Qor4DecodeSectionExists(const Qor4DecodeContext* context, uint32_t section, bool* exists) {
  if (context == nullptr || exists == nullptr) return DERResultParamError;
  switch (section) {
    case 0: *exists = context->manifest.body.data != nullptr; return DERResultSuccess;
    case 1: *exists = context->restoreInfo.properties.data != nullptr; return DERResultSuccess;
    default: return DERResultParamError;
  }
}

bool Qor4DecodeRestoreInfoExists(const Qor4DecodeContext* context) {
  bool exists = false;
  return Qor4DecodeSectionExists(context, 1, &exists) == DERResultSuccess && exists;
}

int Qor4DecodeGetPropertyFromSection(const Qor4DecodeContext* context, uint32_t section,
                                     uint32_t tagNumber, uint32_t tagHigh,
                                     uint32_t valueTagNumber, uint32_t valueTagHigh,
                                     Qor4Property* property) {
  if (context == nullptr || property == nullptr) return DERResultParamError;
  bool exists;
  int result = Qor4DecodeSectionExists(context, section, &exists);
  if (result != DERResultSuccess) return result;
  if (!exists) return DERResultEndOfSequence;

  DERItem dictionary = context->restoreInfo.properties;
  if (section == 0) {
    result = DERQor4DecodeParseManifestProperties(context, nullptr, &dictionary);
    if (result != DERResultSuccess) return result;
  }
  return DERQor4DecodeFindProperty(&dictionary, tagNumber, tagHigh, valueTagNumber, valueTagHigh,
                                   property);
}

int Qor4DecodeGetBooleanFromSection(const Qor4DecodeContext* context, uint32_t section,
                                    uint32_t tagNumber, uint32_t tagHigh, bool* value) {
  if (value == nullptr) return DERResultParamError;
  return SectionValue(context, section, tagNumber, tagHigh, DERTagBoolean, ToBoolean(value));
}

int Qor4DecodeGetIntegerFromSection(const Qor4DecodeContext* context, uint32_t section,
                                    uint32_t tagNumber, uint32_t tagHigh, uint32_t* value) {
  if (value == nullptr) return DERResultParamError;
  return SectionValue(context, section, tagNumber, tagHigh, DERTagInteger, ToInteger(value));
}

int Qor4DecodeGetInteger64FromSection(const Qor4DecodeContext* context, uint32_t section,
                                      uint32_t tagNumber, uint32_t tagHigh, uint64_t* value) {
  if (value == nullptr) return DERResultParamError;
  return SectionValue(context, section, tagNumber, tagHigh, DERTagInteger, ToInteger64(value));
}

int Qor4DecodeGetDataFromSection(const Qor4DecodeContext* context, uint32_t section,
                                 uint32_t tagNumber, uint32_t tagHigh, DERItem* value) {
  if (value == nullptr) return DERResultParamError;
  return SectionValue(context, section, tagNumber, tagHigh, DERTagOctetString, ToItem(value));
}

int Qor4DecodeGetRestoreInfoBoolean(const Qor4DecodeContext* context, uint32_t tagNumber,
                                    uint32_t tagHigh, bool* value) {
  return Qor4DecodeGetBooleanFromSection(context, 1, tagNumber, tagHigh, value);
}

int Qor4DecodeGetRestoreInfoInteger(const Qor4DecodeContext* context, uint32_t tagNumber,
                                    uint32_t tagHigh, uint32_t* value) {
  return Qor4DecodeGetIntegerFromSection(context, 1, tagNumber, tagHigh, value);
}

int Qor4DecodeGetRestoreInfoInteger64(const Qor4DecodeContext* context, uint32_t tagNumber,
                                      uint32_t tagHigh, uint64_t* value) {
  return Qor4DecodeGetInteger64FromSection(context, 1, tagNumber, tagHigh, value);
}

int Qor4DecodeGetRestoreInfoData(const Qor4DecodeContext* context, uint32_t tagNumber,
                                 uint32_t tagHigh, DERItem* value) {
  return Qor4DecodeGetDataFromSection(context, 1, tagNumber, tagHigh, value);
}

// --- Object getters -------------------------------------------------------------------------------

int Qor4DecodeGetObjectProperty(const Qor4DecodeContext* context, uint32_t objectTagNumber,
                                uint32_t objectTagHigh, uint32_t propertyTagNumber,
                                uint32_t propertyTagHigh, uint32_t valueTagNumber,
                                uint32_t valueTagHigh, Qor4Property* property) {
  if (context == nullptr || property == nullptr) return DERResultParamError;
  DERItem bodyDictionary;
  int result = DERQor4DecodeParseManifestProperties(context, &bodyDictionary, nullptr);
  if (result != DERResultSuccess) return result;
  Qor4Property object;
  result = DERQor4DecodeFindProperty(&bodyDictionary, objectTagNumber, objectTagHigh, kSetNumber,
                                     kSetHigh, &object);
  if (result != DERResultSuccess) return result;
  return DERQor4DecodeFindProperty(&object.value, propertyTagNumber, propertyTagHigh,
                                   valueTagNumber, valueTagHigh, property);
}

int Qor4DecodeGetObjectPropertyBoolean(const Qor4DecodeContext* context, uint32_t objectTagNumber,
                                       uint32_t objectTagHigh, uint32_t propertyTagNumber,
                                       uint32_t propertyTagHigh, bool* value) {
  if (value == nullptr) return DERResultParamError;
  return ObjectValue(context, objectTagNumber, objectTagHigh, propertyTagNumber, propertyTagHigh,
                     DERTagBoolean, ToBoolean(value));
}

int Qor4DecodeGetObjectPropertyInteger(const Qor4DecodeContext* context, uint32_t objectTagNumber,
                                       uint32_t objectTagHigh, uint32_t propertyTagNumber,
                                       uint32_t propertyTagHigh, uint32_t* value) {
  if (value == nullptr) return DERResultParamError;
  return ObjectValue(context, objectTagNumber, objectTagHigh, propertyTagNumber, propertyTagHigh,
                     DERTagInteger, ToInteger(value));
}

int Qor4DecodeGetObjectPropertyInteger64(const Qor4DecodeContext* context,
                                         uint32_t objectTagNumber, uint32_t objectTagHigh,
                                         uint32_t propertyTagNumber, uint32_t propertyTagHigh,
                                         uint64_t* value) {
  if (value == nullptr) return DERResultParamError;
  return ObjectValue(context, objectTagNumber, objectTagHigh, propertyTagNumber, propertyTagHigh,
                     DERTagInteger, ToInteger64(value));
}

int Qor4DecodeGetObjectPropertyData(const Qor4DecodeContext* context, uint32_t objectTagNumber,
                                    uint32_t objectTagHigh, uint32_t propertyTagNumber,
                                    uint32_t propertyTagHigh, const uint8_t** data,
                                    uint32_t* length) {
  if (data == nullptr || length == nullptr) return DERResultParamError;
  return ObjectValue(context, objectTagNumber, objectTagHigh, propertyTagNumber, propertyTagHigh,
                     DERTagOctetString, ToBytes(data, length));
}

int Qor4DecodeGetObjectPropertyString(const Qor4DecodeContext* context, uint32_t objectTagNumber,
                                      uint32_t objectTagHigh, uint32_t propertyTagNumber,
                                      uint32_t propertyTagHigh, const uint8_t** data,
                                      uint32_t* length) {
  if (data == nullptr || length == nullptr) return DERResultParamError;
  return ObjectValue(context, objectTagNumber, objectTagHigh, propertyTagNumber, propertyTagHigh,
                     DERTagIA5String, ToBytes(data, length));
}

// --- Values of a delivered property -----------------------------------------------------------------

int Qor4DecodeGetPropertyBoolean(const DERItem* encoding, uint32_t tagNumber, uint32_t tagHigh,
                                 bool* value) {
  if (value == nullptr) return DERResultParamError;
  return EncodedValue(encoding, tagNumber, tagHigh, DERTagBoolean, ToBoolean(value));
}

int Qor4DecodeGetPropertyInteger(const DERItem* encoding, uint32_t tagNumber, uint32_t tagHigh,
                                 uint32_t* value) {
  if (value == nullptr) return DERResultParamError;
  return EncodedValue(encoding, tagNumber, tagHigh, DERTagInteger, ToInteger(value));
}

int Qor4DecodeGetPropertyInteger64(const DERItem* encoding, uint32_t tagNumber,
                                   uint32_t tagHigh, uint64_t* value) {
  if (value == nullptr) return DERResultParamError;
  return EncodedValue(encoding, tagNumber, tagHigh, DERTagInteger, ToInteger64(value));
}

int Qor4DecodeGetPropertyData(const DERItem* encoding, uint32_t tagNumber, uint32_t tagHigh,
                              const uint8_t** data, uint32_t* length) {
  if (data == nullptr || length == nullptr) return DERResultParamError;
  return EncodedValue(encoding, tagNumber, tagHigh, DERTagOctetString, ToBytes(data, length));
}

}  // namespace brisvale
