// Shared by the property-list fuzz targets.
#pragma once

#include <cmath>

#include "base/plist.h"

namespace brisvale::plist {

// NaN never equals itself, so a value holding one cannot be compared after a round trip.
inline bool HasNaN(const Value& value) {
  if (auto real = value.real()) return std::isnan(*real);
  if (const Array* array = value.array()) {
    for (const Value& element : *array) {
      if (HasNaN(element)) return true;
    }
  }
  if (const Dictionary* dictionary = value.dictionary()) {
    for (const auto& entry : *dictionary) {
      if (HasNaN(entry.second)) return true;
    }
  }
  return false;
}

inline std::span<const uint8_t> AsBytes(const std::string& text) {
  return {reinterpret_cast<const uint8_t*>(text.data()), text.size()};
}

}  // namespace brisvale::plist
