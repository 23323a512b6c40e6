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

}  // namespace brisvale::plist::internal
