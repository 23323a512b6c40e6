// Item-spec tables of the container's sections. Offsets come from the section records.
#include <cstddef>
#include <iterator>

#include "verify/container/qor4.h"

namespace brisvale {

#define AT(record, field) static_cast<uint32_t>(offsetof(record, field))

const DERItemSpec DERQor4ItemSpecs[] = {
    {AT(DERQor4, magic), DERTagIA5String, 0},
    {AT(DERQor4, payload), DERTagSequence, DERItemSaveEncoding},
    {AT(DERQor4, manifest), DERTagContextSpecificConstructed(0), DERItemOptional},
    {AT(DERQor4, restoreInfo), DERTagContextSpecificConstructed(1), DERItemOptional},
};
const uint32_t DERNumQor4ItemSpecs = std::size(DERQor4ItemSpecs);

const DERItemSpec DERQor4PayloadItemSpecs[] = {
    {AT(DERQor4Payload, magic), DERTagIA5String, 0},
    {AT(DERQor4Payload, type), DERTagIA5String, 0},
    {AT(DERQor4Payload, version), DERTagIA5String, 0},
    {AT(DERQor4Payload, data), DERTagOctetString, 0},
    {AT(DERQor4Payload, keybag), DERTagOctetString, DERItemOptional},
    {AT(DERQor4Payload, compression), DERTagSequence, DERItemOptional},
};
const uint32_t DERNumQor4PayloadItemSpecs = std::size(DERQor4PayloadItemSpecs);

const DERItemSpec DERQor4CompressionItemSpecs[] = {
    {AT(DERQor4Compression, algorithm), DERTagInteger, 0},
    {AT(DERQor4Compression, uncompressedSize), DERTagInteger, 0},
};
const uint32_t DERNumQor4CompressionItemSpecs = std::size(DERQor4CompressionItemSpecs);

const DERItemSpec DERQor4ManifestItemSpecs[] = {
    {AT(DERQor4Manifest, magic), DERTagIA5String, 0},
    {AT(DERQor4Manifest, version), DERTagInteger, 0},
    {AT(DERQor4Manifest, body), DERTagSet, DERItemSaveEncoding},
    {AT(DERQor4Manifest, signature), DERTagOctetString, 0},
    {AT(DERQor4Manifest, certificateChain), DERTagSequence, 0},
};
const uint32_t DERNumQor4ManifestItemSpecs = std::size(DERQor4ManifestItemSpecs);

const DERItemSpec DERQor4RestoreInfoItemSpecs[] = {
    {AT(DERQor4RestoreInfo, magic), DERTagIA5String, 0},
    {AT(DERQor4RestoreInfo, properties), DERTagSet, 0},
};
const uint32_t DERNumQor4RestoreInfoItemSpecs = std::size(DERQor4RestoreInfoItemSpecs);

#undef AT

}  // namespace brisvale
