// Shared by the property-list tests: readable failure output and byte views.
#pragma once

#include <ostream>
#include <span>
#include <string_view>

#include "base/plist.h"

namespace brisvale::plist {

inline void PrintTo(const Value& value, std::ostream* out) { *out << value.description(); }

inline std::span<const uint8_t> AsBytes(std::string_view text) {
  return {reinterpret_cast<const uint8_t*>(text.data()), text.size()};
}

}  // namespace brisvale::plist
