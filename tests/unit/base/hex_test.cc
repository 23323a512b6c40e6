// Hex text to bytes and bytes to upper-case hex text (base/hex).
#include "base/hex.h"

#include <gtest/gtest.h>

namespace brisvale::BrisvaleMounter {
namespace {

using Bytes = std::vector<uint8_t>;

TEST(Hex, TextToBytes) {
  const struct {
    const char* why;
    std::string text;  // UTF-8
    std::optional<Bytes> expected;
  } cases[] = {
      {"mixed case pairs", "0a1B", Bytes{0x0A, 0x1B}},
      {"odd length gains a leading zero", "A1B", Bytes{0x0A, 0x1B}},
      {"empty text", "", Bytes{}},
      // Letters that are not hex digits pass the check and stop strtol.
      {"non-digit first", "G1", Bytes{0x00}},
      {"non-digit second", "1G", Bytes{0x01}},
      // Other letters, marks and digits are parsed from the low byte of their code unit.
      {"U+0120 low byte is a blank, which strtol skips", "\u01205", Bytes{0x05}},
      {"U+012D low byte is a minus sign", "\u012D5", Bytes{0xFB}},
      {"U+0100 low byte is NUL, which ends the text", "\u01005", Bytes{0x00}},
      {"Arabic-Indic digits U+0661 U+0662 read as 'a' 'b'", "\u0661\u0662", Bytes{0xAB}},
      {"combining mark U+0E31 reads as '1'", "A\u0E31", Bytes{0xA1}},
      {"title-case, modifier, Roman numeral, superscript", "\u01C5\u02B0\u2160\u00B2", Bytes{0x00, 0x00}},
      // U+1D400 is the two UTF-16 units D835 DC00: one pair, and one more unit makes
      // the length odd.
      {"non-BMP letter is one pair", "\U0001D400", Bytes{0x05}},
      {"non-BMP letter plus digit has odd length", "\U0001D4001", Bytes{0x05, 0x00}},
      {"embedded NUL", std::string("0\0a", 3), std::nullopt},
      {"multiplication sign between letter ranges", "0\u00D7", std::nullopt},
      {"emoji", "0a\U0001F600", std::nullopt},
      {"truncated UTF-8", "0a\xC3", std::nullopt},
      {"overlong UTF-8", "\xC0\xB0", std::nullopt},
      {"UTF-8 surrogate", "\xED\xA0\x80", std::nullopt},
      {"above U+10FFFF", "\xF4\x90\x80\x80", std::nullopt},
      {"stray continuation byte", "\x80", std::nullopt},
  };
  for (const auto& c : cases) EXPECT_EQ(dataWithHexString(c.text), c.expected) << c.why;
  EXPECT_EQ(dataWithHexString(std::nullopt), std::nullopt);
}

TEST(Hex, BytesToUpperCaseTextTwoDigitsPerByte) {
  EXPECT_EQ(hexStringWithData(Bytes{0x00, 0xAB, 0xFF, 0x19}), "00ABFF19");
  EXPECT_EQ(hexStringWithData(Bytes{}), "");
  EXPECT_EQ(hexStringWithData(std::nullopt), std::nullopt);
}

}  // namespace
}  // namespace brisvale::BrisvaleMounter
