#include "base/hex.h"

#include <gtest/gtest.h>

#include <optional>
#include <string>
#include <vector>

namespace brisvale::BrisvaleMounter {
namespace {

using Bytes = std::vector<uint8_t>;

struct TextCase {
  const char* why;
  std::string text;  // UTF-8
  std::optional<Bytes> expected;
};

void PrintTo(const TextCase& c, std::ostream* out) { *out << c.why; }

class TextToBytes : public testing::TestWithParam<TextCase> {};

TEST_P(TextToBytes, Converts) {
  EXPECT_EQ(dataWithHexString(GetParam().text), GetParam().expected) << GetParam().why;
}

INSTANTIATE_TEST_SUITE_P(
    Cases, TextToBytes,
    testing::Values(
        TextCase{"mixed case pairs", "0a1B", Bytes{0x0A, 0x1B}},
        TextCase{"odd length gains a leading zero", "A1B", Bytes{0x0A, 0x1B}},
        TextCase{"single digit", "f", Bytes{0x0F}},
        TextCase{"empty text", "", Bytes{}},
        TextCase{"full byte range", "00ff80", Bytes{0x00, 0xFF, 0x80}},
        // Letters that are not hex digits pass the check and stop strtol.
        TextCase{"no digit at all", "ZZ", Bytes{0x00}},
        TextCase{"non-digit first", "G1", Bytes{0x00}},
        TextCase{"non-digit second", "1G", Bytes{0x01}},
        TextCase{"odd length with a non-digit", "G12", Bytes{0x00, 0x12}},
        // Non-ASCII letters and digits are parsed from the low byte of their code unit.
        TextCase{"U+0120 low byte is a blank, which strtol skips", "\u01205", Bytes{0x05}},
        TextCase{"U+012D low byte is a minus sign", "\u012D5", Bytes{0xFB}},
        TextCase{"U+0100 low byte is NUL, which ends the text", "\u01005", Bytes{0x00}},
        TextCase{"Arabic-Indic digits U+0661 U+0662 read as 'a' 'b'", "\u0661\u0662", Bytes{0xAB}},
        TextCase{"combining mark U+0E31 reads as '1'", "A\u0E31", Bytes{0xA1}},
        // U+1D400 is two UTF-16 units, D835 DC00: one pair, and a third unit makes the
        // length odd.
        TextCase{"non-BMP letter is one pair", "\U0001D400", Bytes{0x05}},
        TextCase{"non-BMP letter plus digit has odd length", "\U0001D4001", Bytes{0x05, 0x00}},
        TextCase{"hyphen", "0a-1b", std::nullopt},
        TextCase{"leading blank", " 0a", std::nullopt},
        TextCase{"trailing blank", "0a ", std::nullopt},
        TextCase{"blank inside", "0a 1b", std::nullopt},
        TextCase{"plus sign", "+1", std::nullopt},
        TextCase{"underscore", "0_", std::nullopt},
        TextCase{"embedded NUL", std::string("0\0a", 3), std::nullopt},
        TextCase{"no-break space", "0a\u00A0", std::nullopt},
        TextCase{"emoji", "0a\U0001F600", std::nullopt},
        TextCase{"truncated UTF-8", "0a\xC3", std::nullopt},
        TextCase{"overlong UTF-8", "\xC0\xB0", std::nullopt},
        TextCase{"UTF-8 surrogate", "\xED\xA0\x80", std::nullopt},
        TextCase{"above U+10FFFF", "\xF4\x90\x80\x80", std::nullopt},
        TextCase{"stray continuation byte", "\x80", std::nullopt}));

TEST(TextToBytes, AbsentTextGivesNothing) {
  EXPECT_EQ(dataWithHexString(std::nullopt), std::nullopt);
}

TEST(LetterMarkNumber, FollowsGeneralCategory) {
  struct Case {
    char32_t codePoint;
    bool accepted;
  };
  const Case cases[] = {
      {U'0', true},      {U'z', true},      {U'/', false},    {U':', false},   {U'@', false},
      {U'\u00C5', true},   // Lu
      {U'\u01C5', true},   // Lt
      {U'\u02B0', true},   // Lm
      {U'\u4E2D', true},   // Lo
      {U'\u0903', true},   // Mc
      {U'\u20DD', true},   // Me
      {U'\u2160', true},   // Nl
      {U'\u00B2', true},   // No
      {U'\U0001D7CE', true},  // Nd outside the BMP
      {U'\u00D7', false},  // Sm between two letter ranges
      {U'\u200B', false},  // Cf
      {U'\uE000', false},  // private use
      {U'\U0010FFFF', false},
      {0, false},
  };
  for (const Case& c : cases) {
    EXPECT_EQ(IsLetterMarkOrNumber(c.codePoint), c.accepted) << std::hex << uint32_t(c.codePoint);
  }
}

TEST(BytesToText, UpperCaseTwoDigitsPerByte) {
  const Bytes bytes = {0x00, 0xAB, 0xFF};
  EXPECT_EQ(hexStringWithData(bytes), "00ABFF");
  EXPECT_EQ(hexStringWithData(Bytes{}), "");
  EXPECT_EQ(hexStringWithData(std::nullopt), std::nullopt);
}

TEST(BytesToText, EveryByteRoundTrips) {
  Bytes all(256);
  for (int i = 0; i < 256; ++i) all[i] = static_cast<uint8_t>(i);
  const std::optional<std::string> text = hexStringWithData(all);
  ASSERT_TRUE(text);
  EXPECT_EQ(text->size(), 512u);
  EXPECT_EQ(dataWithHexString(*text), all);
}

}  // namespace
}  // namespace brisvale::BrisvaleMounter
