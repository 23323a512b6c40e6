#include "base/hex.h"

#include <algorithm>
#include <array>
#include <cstdlib>
#include <iterator>
#include <new>

namespace brisvale::BrisvaleMounter {
namespace {

struct CodePointRange {
  char32_t first;
  char32_t last;
};

constexpr CodePointRange kLetterMarkNumberRanges[] = {
#include "base/unicode_lmn_table.inc"
};

constexpr bool RangesAreSortedAndDisjoint() {
  for (size_t i = 0; i < std::size(kLetterMarkNumberRanges); ++i) {
    if (kLetterMarkNumberRanges[i].first > kLetterMarkNumberRanges[i].last) return false;
    if (i > 0 && kLetterMarkNumberRanges[i - 1].last >= kLetterMarkNumberRanges[i].first) return false;
  }
  return true;
}
static_assert(RangesAreSortedAndDisjoint(), "the range table must be sorted for binary search");

// Decodes one UTF-8 sequence at the front of `text`, advancing past it. Rejects
// truncated and overlong sequences, surrogates and values above U+10FFFF.
std::optional<char32_t> DecodeUtf8(std::string_view& text) {
  const auto byte = [&](size_t i) { return static_cast<uint8_t>(text[i]); };
  const uint8_t lead = byte(0);
  size_t length;
  char32_t value;
  char32_t minimum;
  if (lead < 0x80) {
    text.remove_prefix(1);
    return lead;
  } else if (lead >= 0xC2 && lead <= 0xDF) {
    length = 2, value = lead & 0x1F, minimum = 0x80;
  } else if (lead >= 0xE0 && lead <= 0xEF) {
    length = 3, value = lead & 0x0F, minimum = 0x800;
  } else if (lead >= 0xF0 && lead <= 0xF4) {
    length = 4, value = lead & 0x07, minimum = 0x10000;
  } else {
    return std::nullopt;
  }
  if (text.size() < length) return std::nullopt;
  for (size_t i = 1; i < length; ++i) {
    if ((byte(i) & 0xC0) != 0x80) return std::nullopt;
    value = (value << 6) | (byte(i) & 0x3F);
  }
  if (value < minimum || value > 0x10FFFF || (value >= 0xD800 && value <= 0xDFFF)) {
    return std::nullopt;
  }
  text.remove_prefix(length);
  return value;
}

// General category letter (L*), mark (M*) or number (N*).
bool IsLetterMarkOrNumber(char32_t codePoint) {
  const auto* end = std::end(kLetterMarkNumberRanges);
  const auto* range = std::upper_bound(
      std::begin(kLetterMarkNumberRanges), end, codePoint,
      [](char32_t value, const CodePointRange& candidate) { return value < candidate.first; });
  if (range == std::begin(kLetterMarkNumberRanges)) return false;
  --range;
  return codePoint <= range->last;
}

// The text as UTF-16 code units, or none when it is not valid UTF-8 or holds a
// character outside the letters, marks and digits.
std::optional<std::u16string> AlphanumericUtf16(std::string_view text) {
  std::u16string units;
  units.reserve(text.size());
  while (!text.empty()) {
    const std::optional<char32_t> codePoint = DecodeUtf8(text);
    if (!codePoint || !IsLetterMarkOrNumber(*codePoint)) return std::nullopt;
    if (*codePoint < 0x10000) {
      units.push_back(static_cast<char16_t>(*codePoint));
    } else {
      const char32_t offset = *codePoint - 0x10000;
      units.push_back(static_cast<char16_t>(0xD800 + (offset >> 10)));
      units.push_back(static_cast<char16_t>(0xDC00 + (offset & 0x3FF)));
    }
  }
  return units;
}

// strtol, not a hex-digit table: a pair whose low bytes are not two hex digits converts
// by strtol's rules (leading white space and a sign are honoured, parsing stops at the
// first non-digit, a NUL ends the text), and stored signatures depend on that.
uint8_t ParsePair(char16_t high, char16_t low) {
  const std::array<char, 3> digits = {static_cast<char>(high & 0xFF), static_cast<char>(low & 0xFF),
                                      '\0'};
  return static_cast<uint8_t>(std::strtol(digits.data(), nullptr, 16) & 0xFF);
}

char HexDigit(uint8_t nibble) {
  return static_cast<char>(nibble < 10 ? '0' + nibble : 'A' + (nibble - 10));
}

}  // namespace

std::optional<std::vector<uint8_t>> initDataWithHexString(std::optional<std::string_view> text) {
  if (!text) return std::nullopt;
  try {
    std::optional<std::u16string> units = AlphanumericUtf16(*text);
    if (!units) return std::nullopt;
    if (units->size() % 2 != 0) units->insert(units->begin(), u'0');
    std::vector<uint8_t> bytes;
    bytes.reserve(units->size() / 2);
    for (size_t i = 0; i + 1 < units->size(); i += 2) {
      bytes.push_back(ParsePair((*units)[i], (*units)[i + 1]));
    }
    return bytes;
  } catch (const std::bad_alloc&) {
    return std::nullopt;
  }
}

std::optional<std::string> initHexStringWithData(std::optional<std::span<const uint8_t>> data) {
  if (!data) return std::nullopt;
  try {
    std::string text;
    if (data->size() > text.max_size() / 2) return std::nullopt;
    text.resize(data->size() * 2);
    for (size_t i = 0; i < data->size(); ++i) {
      text[2 * i] = HexDigit((*data)[i] >> 4);
      text[2 * i + 1] = HexDigit((*data)[i] & 0x0F);
    }
    return text;
  } catch (const std::bad_alloc&) {
    return std::nullopt;
  }
}

}  // namespace brisvale::BrisvaleMounter
