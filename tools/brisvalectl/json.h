// Property-list values as JSON for scripts: data as lower-case hex text, dates as
// ISO-8601 text, integers as numbers.
#pragma once

#include <string>

#include "base/plist.h"

namespace brisvale::tools {

std::string ToJson(const plist::Value& value, int indent = 0);

}  // namespace brisvale::tools
