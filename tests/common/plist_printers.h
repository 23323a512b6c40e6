// Readable test failures: gtest prints property-list values by their description.
#pragma once

#include <ostream>

#include "base/plist.h"

namespace brisvale::plist {

inline void PrintTo(const Value& value, std::ostream* out) { *out << value.description(); }
inline void PrintTo(const Dictionary& dictionary, std::ostream* out) { *out << Value(dictionary).description(); }

}  // namespace brisvale::plist
