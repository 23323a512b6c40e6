// Hex conversions, the BrisvaleMounter category: hexadecimal text to bytes (how a disk
// image's signature, stored as text in its backing path, becomes "ImageSignature" bytes)
// and bytes to upper-case hexadecimal text.
//
// Text is UTF-8. The text-to-bytes direction keeps the platform's string semantics that
// callers rely on: any Unicode letter, mark or digit passes the character check, lengths
// and pairs are counted in UTF-16 code units, and each pair is parsed by strtol from the
// low 8 bits of its two code units (so "G1" gives 0x00 and "1G" gives 0x01).
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace brisvale::BrisvaleMounter {

// Bytes for `text`, or none when the text is absent, is not valid UTF-8 or holds a
// character that is not a letter, mark or digit. An empty text gives empty bytes; a text
// of odd length reads as if "0" stood in front of it.
std::optional<std::vector<uint8_t>> initDataWithHexString(std::optional<std::string_view> text);

// Two upper-case hex digits per byte, high nibble first; none when `data` is absent or
// the text cannot be allocated.
std::optional<std::string> initHexStringWithData(std::optional<std::span<const uint8_t>> data);

// The class-method spellings. With values instead of reference-counted objects there is
// no receiver to release and no release scope to defer to, so they are the same calls.
inline std::optional<std::vector<uint8_t>> dataWithHexString(std::optional<std::string_view> text) {
  return initDataWithHexString(text);
}
inline std::optional<std::string> hexStringWithData(std::optional<std::span<const uint8_t>> data) {
  return initHexStringWithData(data);
}

}  // namespace brisvale::BrisvaleMounter
