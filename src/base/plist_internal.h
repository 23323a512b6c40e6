// Helpers shared by the property-list value and its codecs; not for use outside
// src/base/plist*.cc.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "base/plist.h"

namespace brisvale::plist::internal {

// "2014-04-10T22:55:30Z": the date floored to whole seconds, kept within the years
// 0001..9999 that the four-digit form can carry (NaN reads as the reference date).
std::string FormatIsoDate(Date date);
// The exact form FormatIsoDate writes, with calendar-valid fields.
std::optional<Date> ParseIsoDate(std::string_view text);

// Decodes one UTF-8 sequence at text[pos]; returns the code point and advances pos,
// or returns none (pos unchanged) for an invalid, overlong or surrogate sequence.
std::optional<char32_t> DecodeUtf8(std::string_view text, size_t& pos);
void AppendUtf8(std::string& out, char32_t codePoint);

}  // namespace brisvale::plist::internal
