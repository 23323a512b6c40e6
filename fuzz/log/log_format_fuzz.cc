// The log formatter with hostile values: the input is a property list (the value %@
// prints, often a small document whose references share one large object) followed by
// a format. No line may pass its bound, whatever the value or the format.
#include <cstdlib>
#include <span>
#include <string_view>

#include "base/log.h"
#include "base/plist.h"

using namespace brisvale;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 2) return 0;
  // First byte: how many of the bytes after it are the format.
  const size_t formatLength = std::min<size_t>(data[0], size - 1);
  const std::string_view format(reinterpret_cast<const char*>(data + 1), formatLength);
  const std::span<const uint8_t> document(data + 1 + formatLength, size - 1 - formatLength);
  const std::optional<plist::Value> value = plist::Read(document);
  const plist::Value fallback{std::string(format)};
  const plist::Value& shown = value ? *value : fallback;

  const std::string line = log::Format(format, {shown, "text", shown, 7, shown});
  // The format's own text is copied as is; everything added to it is bounded.
  if (line.size() > log::kMaxLineLength + plist::kDescriptionCut.size()) std::abort();
  const std::string description = shown.description(log::kMaxValueLength);
  if (description.size() > log::kMaxValueLength + plist::kDescriptionCut.size()) std::abort();
  return 0;
}
