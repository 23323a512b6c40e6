// DER encoding for the signing tool and the tests: elements with any tag and length,
// the universal types the image-verification layers read, and the signed container
// ("QOR4") with its payload, manifest and restore-info sections. Everything returns the
// complete encoding of one element as bytes; containers take already-encoded children.
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace brisvale::derwriter {

using Bytes = std::vector<uint8_t>;

// Tags use the decoder's 64-bit layout: class in bits 63-62, constructed in bit 61,
// tag number in bits 60-0.
inline constexpr uint64_t kClassUniversal = 0x0000000000000000ull;
inline constexpr uint64_t kClassApplication = 0x4000000000000000ull;
inline constexpr uint64_t kClassContextSpecific = 0x8000000000000000ull;
inline constexpr uint64_t kClassPrivate = 0xC000000000000000ull;
inline constexpr uint64_t kConstructed = 0x2000000000000000ull;

inline constexpr uint64_t kTagBoolean = 0x01;
inline constexpr uint64_t kTagInteger = 0x02;
inline constexpr uint64_t kTagBitString = 0x03;
inline constexpr uint64_t kTagOctetString = 0x04;
inline constexpr uint64_t kTagNull = 0x05;
inline constexpr uint64_t kTagOid = 0x06;
inline constexpr uint64_t kTagUtf8String = 0x0C;
inline constexpr uint64_t kTagPrintableString = 0x13;
inline constexpr uint64_t kTagIA5String = 0x16;
inline constexpr uint64_t kTagSequence = kConstructed | 0x10;
inline constexpr uint64_t kTagSet = kConstructed | 0x11;

constexpr uint64_t ContextTag(uint64_t number, bool constructed) {
  return kClassContextSpecific | (constructed ? kConstructed : 0) | number;
}
constexpr uint64_t PrivateConstructedTag(uint64_t number) {
  return kClassPrivate | kConstructed | number;
}

// A four-character code as a number, most significant byte first ("MANB" = 0x4D414E42).
// Precondition: exactly four characters.
constexpr uint32_t FourCC(std::string_view code) {
  return (uint32_t{static_cast<uint8_t>(code[0])} << 24) |
         (uint32_t{static_cast<uint8_t>(code[1])} << 16) |
         (uint32_t{static_cast<uint8_t>(code[2])} << 8) | uint32_t{static_cast<uint8_t>(code[3])};
}

// --- Elements -------------------------------------------------------------------------

// Identifier octets: low form for tag numbers up to 30, high form beyond.
Bytes EncodeIdentifier(uint64_t tag);
// Length octets: short form up to 127, else the fewest long-form octets.
Bytes EncodeLength(uint64_t length);
// Identifier, length and content.
Bytes Element(uint64_t tag, std::span<const uint8_t> content);
// Identifier and content around explicitly supplied length octets (for malformed cases).
Bytes ElementWithLengthOctets(uint64_t tag, std::span<const uint8_t> lengthOctets,
                              std::span<const uint8_t> content);

Bytes Concat(std::initializer_list<std::span<const uint8_t>> parts);
Bytes Concat(const std::vector<Bytes>& parts);

Bytes Sequence(const std::vector<Bytes>& children);
Bytes Set(const std::vector<Bytes>& children);
// A constructed element of any tag around encoded children.
Bytes Constructed(uint64_t tag, const std::vector<Bytes>& children);

Bytes Integer(uint64_t value);
// INTEGER from unsigned big-endian magnitude bytes (leading zeros trimmed, sign byte
// added when needed): for RSA moduli and other large numbers.
Bytes UnsignedInteger(std::span<const uint8_t> magnitude);
Bytes Boolean(bool value);
Bytes Null();
Bytes OctetString(std::span<const uint8_t> bytes);
Bytes OctetString(std::string_view text);
Bytes IA5String(std::string_view text);
Bytes PrintableString(std::string_view text);
Bytes Utf8String(std::string_view text);
Bytes BitString(std::span<const uint8_t> bytes, uint8_t unusedBits = 0);
// Content octets of an OBJECT IDENTIFIER given in dotted form ("1.2.840.113549.1.1.11").
// Returns an empty vector for a malformed text.
Bytes OidContent(std::string_view dotted);
Bytes Oid(std::string_view dotted);

// --- Signed container -------------------------------------------------------------------

// A property [PRIVATE code] { SEQUENCE { IA5String code, value } }; `value` is an encoded
// element (BOOLEAN, INTEGER, OCTET STRING, IA5String, or a SET of constraint properties).
Bytes Property(std::string_view code, const Bytes& value);
Bytes BooleanProperty(std::string_view code, bool value);
Bytes IntegerProperty(std::string_view code, uint64_t value);
Bytes DataProperty(std::string_view code, std::span<const uint8_t> value);
Bytes StringProperty(std::string_view code, std::string_view value);

// A dictionary [PRIVATE code] { SEQUENCE { IA5String code, SET { properties } } }, used
// for "MANB", "MANP", objects such as "pdmg", and constraint groups "MANP"/"OBJP".
Bytes Dictionary(std::string_view code, const std::vector<Bytes>& properties);

struct ManifestObject {
  std::string code;  // four characters, e.g. "pdmg"
  std::vector<Bytes> properties;
};

// The signed bytes of a manifest: SET { "MANB" dictionary holding the "MANP" dictionary
// and one dictionary per object }. Properties keep the given order.
Bytes ManifestBody(const std::vector<Bytes>& manifestProperties,
                   const std::vector<ManifestObject>& objects);

// SEQUENCE { "QO4M", INTEGER version, body, OCTET STRING signature,
//            SEQUENCE { certificates... } }. Certificates are DER, issuer first.
Bytes Manifest(const Bytes& body, std::span<const uint8_t> signature,
               const std::vector<Bytes>& certificates, uint64_t version = 0);

struct CompressionInfo {
  uint64_t algorithm;
  uint64_t uncompressedSize;
};

// SEQUENCE { "QO4P", type, version, OCTET STRING data, [keybag], [compression] }.
Bytes Payload(std::string_view type, std::string_view version, std::span<const uint8_t> data,
              const std::optional<Bytes>& keybag = std::nullopt,
              const std::optional<CompressionInfo>& compression = std::nullopt);

// SEQUENCE { "QO4R", SET { properties } }.
Bytes RestoreInfo(const std::vector<Bytes>& properties);

// SEQUENCE { "QOR4", payload, [0] { manifest }, [1] { restore info } }; absent sections
// are left out. `magic` exists to build refused containers.
Bytes Container(const Bytes& payload, const std::optional<Bytes>& manifest,
                const std::optional<Bytes>& restoreInfo = std::nullopt,
                std::string_view magic = "QOR4");

}  // namespace brisvale::derwriter
