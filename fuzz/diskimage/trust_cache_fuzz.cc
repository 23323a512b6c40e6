// The code-integrity service's structure check; whatever it accepts must survive a
// rebuild from its own entries unchanged.
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <span>

#include "platform/linux/format_trust_cache.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  using namespace brisvale::formats;
  const std::span<const uint8_t> cache(data, size);
  if (!CheckTrustCache(cache).empty()) return 0;
  std::vector<TrustCacheEntry> entries;
  for (size_t offset = kTrustCacheHeaderSize; offset < size; offset += kTrustCacheEntrySize) {
    TrustCacheEntry entry;
    std::memcpy(entry.hash.data(), data + offset, entry.hash.size());
    std::memcpy(&entry.flags, data + offset + 32, sizeof entry.flags);
    entries.push_back(entry);
  }
  const std::vector<uint8_t> rebuilt = BuildTrustCache(entries);
  if (rebuilt.size() != size || std::memcmp(rebuilt.data(), data, size) != 0) __builtin_trap();
  return 0;
}
