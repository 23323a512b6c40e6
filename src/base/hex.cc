#include "base/hex.h"

#include <algorithm>
#include <array>
#include <cstdlib>
#include <iterator>
#include <new>

#include "base/utf8.h"

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
  for (size_t pos = 0; pos < text.size();) {
    const std::optional<char32_t> codePoint = utf8::Decode(text, pos);
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
