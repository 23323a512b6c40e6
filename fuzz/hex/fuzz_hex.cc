// Arbitrary bytes as hex text, and as data to print and read back.
#include <cstdlib>
#include <string_view>

#include "base/hex.h"

namespace hex = brisvale::BrisvaleMounter;

static bool IsAsciiHexDigit(char c) {
  return (c >= '0' && c <= '9') || (c >= 'a' && c <= 'f') || (c >= 'A' && c <= 'F');
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string_view text(reinterpret_cast<const char*>(data), size);
  const auto bytes = hex::dataWithHexString(text);

  // Text made of hex digits alone always converts, and prints back as itself in upper
  // case (with the supplied leading zero when its length is odd).
  bool allHex = true;
  for (char c : text) allHex = allHex && IsAsciiHexDigit(c);
  if (allHex) {
    if (!bytes || bytes->size() != (size + 1) / 2) std::abort();
    const auto printed = hex::hexStringWithData(*bytes);
    std::string expected = size % 2 ? "0" : "";
    for (char c : text) expected.push_back(c >= 'a' ? static_cast<char>(c - 'a' + 'A') : c);
    if (printed != expected) std::abort();
  }

  const auto printed = hex::hexStringWithData(std::span<const uint8_t>(data, size));
  if (!printed || hex::dataWithHexString(*printed) != std::vector<uint8_t>(data, data + size)) std::abort();
  return 0;
}
