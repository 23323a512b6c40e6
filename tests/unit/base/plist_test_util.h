// Shared by the property-list tests: readable failure output and byte views of text.
#pragma once

#include <span>
#include <string_view>

#include "plist_printers.h"

namespace brisvale::plist {

inline std::span<const uint8_t> AsBytes(std::string_view text) {
  return {reinterpret_cast<const uint8_t*>(text.data()), text.size()};
}

}  // namespace brisvale::plist
