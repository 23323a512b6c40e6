// UTF-8 decoding and encoding shared by the property-list codecs, the hex conversions
// and the inventory's text checks. Decoding is strict: truncated and overlong sequences,
// surrogates and values above U+10FFFF are refused.
#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace brisvale::utf8 {

// Decodes one sequence at text[pos]; returns the code point and advances pos, or
// returns none (pos unchanged).
std::optional<char32_t> Decode(std::string_view text, size_t& pos);
void Append(std::string& out, char32_t codePoint);
bool IsValid(std::string_view text);

}  // namespace brisvale::utf8
