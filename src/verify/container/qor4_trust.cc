// Trust evaluation of a decoded manifest: digest, chain and signature through the
// parameter set's slots, certificate constraints, then every manifest and object
// property handed to the caller's callback in encoding order.
#include <cstring>

#include "verify/container/qor4.h"

namespace brisvale {

namespace {

constexpr uint32_t kSetNumber = static_cast<uint32_t>(DERTagSet);
constexpr uint32_t kSetHigh = static_cast<uint32_t>(DERTagSet >> 32);
constexpr uint32_t kLegacyDigestLength = 20;

constexpr uint32_t TagNumber(DERTag tag) { return static_cast<uint32_t>(tag); }
constexpr uint32_t TagHigh(DERTag tag) { return static_cast<uint32_t>(tag >> 32); }

bool IsDeliverableValueTag(DERTag tag) {
  return tag == DERTagBoolean || tag == DERTagInteger || tag == DERTagOctetString ||
         tag == DERTagIA5String;
}

// Fills the body dictionary, the "MANP" properties and the evaluated object's properties.
int LocateDictionaries(uint32_t objectCode, Qor4DecodeContext* context) {
  int result = DERQor4DecodeParseManifestProperties(context, &context->manifestBodyDictionary,
                                                    &context->manifestProperties);
  if (result != DERResultSuccess) return result;
  Qor4Property object;
  result = DERQor4DecodeFindProperty(&context->manifestBodyDictionary, objectCode, 0, kSetNumber,
                                     kSetHigh, &object);
  if (result != DERResultSuccess) return result;
  context->objectProperties = object.value;
  return DERResultSuccess;
}

int WalkBothDictionaries(const Qor4DecodeContext* context, Qor4PropertyCallback callback,
                         void* callbackContext) {
  const int result = Qor4DecodeEvaluateManifestProperties(context, callback, callbackContext);
  if (result != DERResultSuccess) return result;
  return Qor4DecodeEvaluateObjectProperties(context, callback, callbackContext);
}

// One constraint against the property of the same tag in `dictionary`.
int CheckConstraint(const DERDecodedItem& constraint, const DERItem& dictionary) {
  Qor4Property pinned;
  int result = DERQor4DecodeProperty(&constraint.content, TagNumber(constraint.tag),
                                     TagHigh(constraint.tag), &pinned);
  if (result != DERResultSuccess) return result;
  DERItem actual;
  result = DERQor4DecodeContentFindItemWithTag(&dictionary, TagNumber(constraint.tag),
                                               TagHigh(constraint.tag), &actual);
  switch (pinned.valueTag) {
    case DERTagBoolean:
    case DERTagInteger:
    case DERTagOctetString:
      if (result != DERResultSuccess) return result;
      return DEROidCompare(&actual, &constraint.content) ? int{DERResultSuccess} : -1;
    case DERTagContextSpecificConstructed(0):  // must be present, any value
      return result;
    case DERTagContextSpecificConstructed(1):  // may be absent
      return result == DERResultEndOfSequence ? int{DERResultSuccess} : result;
    default:
      return DERResultUnexpectedTag;
  }
}

}  // namespace

int Qor4DecodePerformTrustEvaluatationWithCallbacks(uint32_t objectCode,
                                                    Qor4DecodeContext* context,
                                                    const Qor4PropertyCallbacks* callbacks,
                                                    const Qor4SecureBootParams* params,
                                                    void* callbackContext) {
  if (context == nullptr || callbacks == nullptr || params == nullptr ||
      callbacks->propertyCallback == nullptr || params->computeDigest == nullptr ||
      params->evaluateCertificateProperties == nullptr || params->verifyChain == nullptr ||
      params->verifySignature == nullptr || params->digestInfo == nullptr ||
      !Qor4DecodeManifestExists(context)) {
    return DERResultParamError;
  }
  const uint32_t digestLength = params->digestInfo->digestLength;
  if (digestLength > kQor4MaxDigestLength) return DERResultOverflow;

  int result = params->computeDigest(context->manifestEncoding.data,
                                     context->manifestEncoding.length, context->manifestHash,
                                     digestLength, params);
  if (result != 0) return result;
  context->manifestHashValid = 1;

  // A manifest this device accepted before is not verified again.
  bool alreadyAccepted = false;
  if (callbacks->storedManifestHash != nullptr) {
    const uint8_t* stored = callbacks->storedManifestHash(context, callbackContext);
    alreadyAccepted =
        stored != nullptr && std::memcmp(stored, context->manifestHash, digestLength) == 0;
  }

  if (!alreadyAccepted) {
    const uint8_t* publicKey = nullptr;
    uint32_t publicKeyLength = 0;
    result = params->verifyChain(context->manifest.certificateChain.data,
                                 context->manifest.certificateChain.length, &publicKey,
                                 &publicKeyLength, &context->certificateProperties.data,
                                 &context->certificateProperties.length, params, callbackContext);
    if (result != 0) return result;
    result = params->computeDigest(context->manifest.body.data, context->manifest.body.length,
                                   context->manifestBodyDigest, digestLength, params);
    if (result != 0) return result;
    result = params->verifySignature(publicKey, publicKeyLength, context->manifest.signature.data,
                                     context->manifest.signature.length,
                                     context->manifestBodyDigest, digestLength, params,
                                     callbackContext);
    if (result != 0) return result;
  }

  result = LocateDictionaries(objectCode, context);
  if (result != DERResultSuccess) return result;

  if (!alreadyAccepted) {
    result = params->evaluateCertificateProperties(context, callbackContext);
    if (result != 0) return result;
  }

  if (Qor4DecodePayloadExists(context)) {
    result = params->computeDigest(context->payloadEncoding.data, context->payloadEncoding.length,
                                   context->payloadHash, digestLength, params);
    if (result != 0) return result;
    context->payloadHashValid = 1;
  }

  return WalkBothDictionaries(context, callbacks->propertyCallback, callbackContext);
}

int Qor4DecodePerformTrustEvaluatation(uint32_t objectCode, Qor4DecodeContext* context,
                                       Qor4PropertyCallback propertyCallback,
                                       const Qor4SecureBootParams* params,
                                       void* callbackContext) {
  const Qor4PropertyCallbacks callbacks = {propertyCallback, nullptr};
  return Qor4DecodePerformTrustEvaluatationWithCallbacks(objectCode, context, &callbacks, params,
                                                         callbackContext);
}

int Qor4DecodeEvaluateTrustWithCallbacks(uint32_t objectCode, Qor4DecodeContext* context,
                                         Qor4PropertyCallback propertyCallback,
                                         Qor4SignatureWithChainFunction signatureWithChain,
                                         Qor4EvaluateCertificatePropertiesFunction
                                             evaluateCertificateProperties,
                                         Qor4HashFunction hash, void* callbackContext) {
  if (context == nullptr || propertyCallback == nullptr || signatureWithChain == nullptr ||
      evaluateCertificateProperties == nullptr || hash == nullptr ||
      !Qor4DecodeManifestExists(context)) {
    return DERResultParamError;
  }
  hash(context->manifest.body.data, context->manifest.body.length, context->manifestBodyDigest);
  int result = signatureWithChain(
      context->manifest.certificateChain.data, context->manifest.certificateChain.length,
      context->manifest.signature.data, context->manifest.signature.length,
      context->manifestBodyDigest, kLegacyDigestLength, &context->certificateProperties.data,
      &context->certificateProperties.length);
  if (result != 0) return result;

  result = LocateDictionaries(objectCode, context);
  if (result != DERResultSuccess) return result;
  result = evaluateCertificateProperties(context, callbackContext);
  if (result != 0) return result;

  if (Qor4DecodePayloadExists(context)) {
    hash(context->payloadEncoding.data, context->payloadEncoding.length, context->payloadHash);
    context->payloadHashValid = 1;
  }
  result = WalkBothDictionaries(context, propertyCallback, callbackContext);
  if (result != 0) return result;

  hash(context->manifestEncoding.data, context->manifestEncoding.length, context->manifestHash);
  context->manifestHashValid = 1;
  return DERResultSuccess;
}

int Qor4DecodeEvaluateDictionaryProperties(const DERItem* dictionary, uint32_t dictionaryKind,
                                           Qor4PropertyCallback propertyCallback,
                                           void* callbackContext) {
  if (dictionary == nullptr || propertyCallback == nullptr) return DERResultParamError;
  DERSequence sequence;
  DERDecodeSeqContentInit(dictionary, &sequence);
  while (true) {
    DERDecodedItem element;
    int result = DERDecodeSeqNext(&sequence, &element);
    if (result == DERResultEndOfSequence) return DERResultSuccess;
    if (result != DERResultSuccess) return result;

    Qor4Property property;
    result = DERQor4DecodeProperty(&element.content, TagNumber(element.tag), TagHigh(element.tag),
                                   &property);
    if (result != DERResultSuccess) return result;
    if (!IsDeliverableValueTag(property.valueTag) || (element.tag & DERTagConstructed) == 0 ||
        (element.tag & DERTagClassMask) == DERTagClassUniversal) {
      return DERResultUnexpectedTag;
    }
    result = propertyCallback(TagNumber(element.tag), Qor4PropertyRef{element.content,
                                                                      property.valueTag},
                              dictionaryKind, callbackContext);
    if (result != 0) return result;
  }
}

int Qor4DecodeEvaluateManifestProperties(const Qor4DecodeContext* context,
                                         Qor4PropertyCallback propertyCallback,
                                         void* callbackContext) {
  if (context == nullptr) return DERResultParamError;
  return Qor4DecodeEvaluateDictionaryProperties(&context->manifestProperties,
                                                kQor4DictionaryManifest, propertyCallback,
                                                callbackContext);
}

int Qor4DecodeEvaluateObjectProperties(const Qor4DecodeContext* context,
                                       Qor4PropertyCallback propertyCallback,
                                       void* callbackContext) {
  if (context == nullptr) return DERResultParamError;
  return Qor4DecodeEvaluateDictionaryProperties(&context->objectProperties, kQor4DictionaryObject,
                                                propertyCallback, callbackContext);
}

int Qor4DecodeEvaluateCertificateProperties(Qor4DecodeContext* context, void* /*callbackContext*/) {
  if (context == nullptr) return DERResultParamError;
  if (context->certificateProperties.data == nullptr || context->certificateProperties.length == 0) {
    return DERResultDecodeError;
  }
  DERTag tag;
  DERSequence groups;
  int result = DERDecodeSeqInit(&context->certificateProperties, &tag, &groups);
  if (result != DERResultSuccess) return result;
  if (tag != DERTagSet) return DERResultUnexpectedTag;

  while (true) {
    DERDecodedItem group;
    // The constraint list ends at its end or at the first element that does not decode.
    if (DERDecodeSeqNext(&groups, &group) != DERResultSuccess) return DERResultSuccess;

    const DERItem* dictionary;
    if (group.tag == DERTagPrivateConstructed(kQor4ManifestProperties)) {
      dictionary = &context->manifestProperties;
    } else if (group.tag == DERTagPrivateConstructed(kQor4ObjectProperties)) {
      dictionary = &context->objectProperties;
    } else {
      return DERResultUnexpectedTag;
    }
    Qor4Property constraints;
    result = DERQor4DecodeProperty(&group.content, TagNumber(group.tag), 0, &constraints);
    if (result != DERResultSuccess) return result;
    if (constraints.valueTag != DERTagSet) return DERResultUnexpectedTag;

    DERSequence sequence;
    DERDecodeSeqContentInit(&constraints.value, &sequence);
    while (true) {
      DERDecodedItem constraint;
      result = DERDecodeSeqNext(&sequence, &constraint);
      if (result == DERResultEndOfSequence) break;
      if (result != DERResultSuccess) return result;
      result = CheckConstraint(constraint, *dictionary);
      if (result != DERResultSuccess) return result;
    }
  }
}

}  // namespace brisvale
