// The text-encoding choice over an untrusted master directory block; the first four
// bytes stand for the encoding bias and the rest for user 0's encoding file.
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <span>
#include <string>

#include "diskimage/text_encoding.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 4) return 0;
  int32_t bias = 0;
  std::memcpy(&bias, data, sizeof bias);
  const std::span<const uint8_t> rest(data + 4, size - 4);
  const std::span<const uint8_t> block = rest.first(std::min<size_t>(rest.size(), 512));
  const std::string userFile(rest.begin() + static_cast<ptrdiff_t>(block.size()), rest.end());
  const uint32_t encoding = brisvale::ChooseTextEncoding(
      block, {[&] { return bias; }, [&] { return std::optional<std::string>(userFile); }});
  if (encoding != brisvale::kNoTextEncoding && encoding > 152) __builtin_trap();
  return 0;
}
