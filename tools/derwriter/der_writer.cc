// DER encoding of elements and of the signed container.
#include "derwriter/der_writer.h"

#include <charconv>

namespace brisvale::derwriter {

namespace {

constexpr uint64_t kTagNumberMask = 0x1FFFFFFFFFFFFFFFull;

Bytes TextBytes(std::string_view text) { return Bytes(text.begin(), text.end()); }

// Base-128 digits, most significant first, bit 7 set on all but the last.
void AppendBase128(Bytes& out, uint64_t value) {
  uint8_t digits[10];
  int count = 0;
  do {
    digits[count++] = static_cast<uint8_t>(value & 0x7F);
    value >>= 7;
  } while (value != 0);
  while (count > 0) {
    const uint8_t digit = digits[--count];
    out.push_back(count > 0 ? (digit | 0x80) : digit);
  }
}

}  // namespace

Bytes EncodeIdentifier(uint64_t tag) {
  const uint8_t leading = static_cast<uint8_t>(tag >> 56) & 0xE0;
  const uint64_t number = tag & kTagNumberMask;
  if (number < 0x1F) return {static_cast<uint8_t>(leading | number)};
  Bytes out{static_cast<uint8_t>(leading | 0x1F)};
  AppendBase128(out, number);
  return out;
}

Bytes EncodeLength(uint64_t length) {
  if (length < 0x80) return {static_cast<uint8_t>(length)};
  Bytes octets;
  for (uint64_t rest = length; rest != 0; rest >>= 8) {
    octets.insert(octets.begin(), static_cast<uint8_t>(rest & 0xFF));
  }
  octets.insert(octets.begin(), static_cast<uint8_t>(0x80 | octets.size()));
  return octets;
}

Bytes ElementWithLengthOctets(uint64_t tag, std::span<const uint8_t> lengthOctets,
                              std::span<const uint8_t> content) {
  Bytes out = EncodeIdentifier(tag);
  out.insert(out.end(), lengthOctets.begin(), lengthOctets.end());
  out.insert(out.end(), content.begin(), content.end());
  return out;
}

Bytes Element(uint64_t tag, std::span<const uint8_t> content) {
  return ElementWithLengthOctets(tag, EncodeLength(content.size()), content);
}

Bytes Concat(std::initializer_list<std::span<const uint8_t>> parts) {
  Bytes out;
  for (auto part : parts) out.insert(out.end(), part.begin(), part.end());
  return out;
}

Bytes Concat(const std::vector<Bytes>& parts) {
  Bytes out;
  for (const Bytes& part : parts) out.insert(out.end(), part.begin(), part.end());
  return out;
}

Bytes Constructed(uint64_t tag, const std::vector<Bytes>& children) {
  return Element(tag | kConstructed, Concat(children));
}

Bytes Sequence(const std::vector<Bytes>& children) { return Constructed(kTagSequence, children); }
Bytes Set(const std::vector<Bytes>& children) { return Constructed(kTagSet, children); }

Bytes Integer(uint64_t value) {
  Bytes magnitude;
  for (int shift = 56; shift >= 0; shift -= 8) {
    magnitude.push_back(static_cast<uint8_t>(value >> shift));
  }
  return UnsignedInteger(magnitude);
}

Bytes UnsignedInteger(std::span<const uint8_t> magnitude) {
  size_t first = 0;
  while (first + 1 < magnitude.size() && magnitude[first] == 0) first++;
  Bytes content;
  if (magnitude.empty()) {
    content.push_back(0);
  } else {
    if (magnitude[first] & 0x80) content.push_back(0);
    content.insert(content.end(), magnitude.begin() + first, magnitude.end());
  }
  return Element(kTagInteger, content);
}

Bytes Boolean(bool value) {
  const uint8_t octet = value ? 0xFF : 0x00;
  return Element(kTagBoolean, std::span(&octet, 1));
}

Bytes Null() { return Element(kTagNull, {}); }
Bytes OctetString(std::span<const uint8_t> bytes) { return Element(kTagOctetString, bytes); }
Bytes OctetString(std::string_view text) { return Element(kTagOctetString, TextBytes(text)); }
Bytes IA5String(std::string_view text) { return Element(kTagIA5String, TextBytes(text)); }
Bytes PrintableString(std::string_view text) {
  return Element(kTagPrintableString, TextBytes(text));
}
Bytes Utf8String(std::string_view text) { return Element(kTagUtf8String, TextBytes(text)); }

Bytes BitString(std::span<const uint8_t> bytes, uint8_t unusedBits) {
  Bytes content{unusedBits};
  content.insert(content.end(), bytes.begin(), bytes.end());
  return Element(kTagBitString, content);
}

Bytes OidContent(std::string_view dotted) {
  std::vector<uint64_t> arcs;
  while (!dotted.empty()) {
    const size_t dot = dotted.find('.');
    const std::string_view arcText = dotted.substr(0, dot);
    uint64_t arc = 0;
    const auto [end, error] = std::from_chars(arcText.data(), arcText.data() + arcText.size(), arc);
    if (error != std::errc() || end != arcText.data() + arcText.size() || arcText.empty()) {
      return {};
    }
    arcs.push_back(arc);
    dotted = dot == std::string_view::npos ? std::string_view() : dotted.substr(dot + 1);
  }
  if (arcs.size() < 2 || arcs[0] > 2 || (arcs[0] < 2 && arcs[1] > 39)) return {};
  Bytes out;
  AppendBase128(out, arcs[0] * 40 + arcs[1]);
  for (size_t i = 2; i < arcs.size(); i++) AppendBase128(out, arcs[i]);
  return out;
}

Bytes Oid(std::string_view dotted) { return Element(kTagOid, OidContent(dotted)); }

Bytes Property(std::string_view code, const Bytes& value) {
  return Constructed(PrivateConstructedTag(FourCC(code)), {Sequence({IA5String(code), value})});
}

Bytes BooleanProperty(std::string_view code, bool value) { return Property(code, Boolean(value)); }
Bytes IntegerProperty(std::string_view code, uint64_t value) {
  return Property(code, Integer(value));
}
Bytes DataProperty(std::string_view code, std::span<const uint8_t> value) {
  return Property(code, OctetString(value));
}
Bytes StringProperty(std::string_view code, std::string_view value) {
  return Property(code, IA5String(value));
}

Bytes Dictionary(std::string_view code, const std::vector<Bytes>& properties) {
  return Property(code, Set(properties));
}

Bytes ManifestBody(const std::vector<Bytes>& manifestProperties,
                   const std::vector<ManifestObject>& objects) {
  std::vector<Bytes> entries{Dictionary("MANP", manifestProperties)};
  for (const ManifestObject& object : objects) {
    entries.push_back(Dictionary(object.code, object.properties));
  }
  return Set({Dictionary("MANB", entries)});
}

Bytes Manifest(const Bytes& body, std::span<const uint8_t> signature,
               const std::vector<Bytes>& certificates, uint64_t version) {
  return Sequence({IA5String("QO4M"), Integer(version), body, OctetString(signature),
                   Sequence(certificates)});
}

Bytes Payload(std::string_view type, std::string_view version, std::span<const uint8_t> data,
              const std::optional<Bytes>& keybag,
              const std::optional<CompressionInfo>& compression) {
  std::vector<Bytes> rows{IA5String("QO4P"), IA5String(type), IA5String(version),
                          OctetString(data)};
  if (keybag) rows.push_back(OctetString(*keybag));
  if (compression) {
    rows.push_back(
        Sequence({Integer(compression->algorithm), Integer(compression->uncompressedSize)}));
  }
  return Sequence(rows);
}

Bytes RestoreInfo(const std::vector<Bytes>& properties) {
  return Sequence({IA5String("QO4R"), Set(properties)});
}

Bytes Container(const Bytes& payload, const std::optional<Bytes>& manifest,
                const std::optional<Bytes>& restoreInfo, std::string_view magic) {
  std::vector<Bytes> rows{IA5String(magic), payload};
  if (manifest) rows.push_back(Constructed(ContextTag(0, true), {*manifest}));
  if (restoreInfo) rows.push_back(Constructed(ContextTag(1, true), {*restoreInfo}));
  return Sequence(rows);
}

}  // namespace brisvale::derwriter
