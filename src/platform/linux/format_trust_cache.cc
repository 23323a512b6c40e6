#include "platform/linux/format_trust_cache.h"

#include <algorithm>
#include <cstring>

namespace brisvale::formats {
namespace {

uint32_t Little32(std::span<const uint8_t> bytes, size_t offset) {
  return uint32_t{bytes[offset]} | uint32_t{bytes[offset + 1]} << 8 | uint32_t{bytes[offset + 2]} << 16 |
         uint32_t{bytes[offset + 3]} << 24;
}

void PutLittle32(std::vector<uint8_t>& out, uint32_t value) {
  for (int shift = 0; shift < 32; shift += 8) out.push_back(static_cast<uint8_t>(value >> shift));
}

}  // namespace

std::string CheckTrustCache(std::span<const uint8_t> cache) {
  if (cache.size() < kTrustCacheHeaderSize) return "shorter than its header";
  if (Little32(cache, 0) != kTrustCacheMagic) return "bad magic";
  if (Little32(cache, 4) != kTrustCacheVersion) return "unknown version";
  const uint32_t count = Little32(cache, 8);
  if (Little32(cache, 12) != 0) return "reserved field set";
  if (count > kMaxTrustCacheEntries) return "too many entries";
  // 64-bit arithmetic: the count is bounded above, so this cannot overflow.
  if (cache.size() != kTrustCacheHeaderSize + uint64_t{count} * kTrustCacheEntrySize) {
    return "size does not match the entry count";
  }
  const uint8_t* previous = nullptr;
  for (size_t offset = kTrustCacheHeaderSize; offset < cache.size(); offset += kTrustCacheEntrySize) {
    const uint8_t* hash = cache.data() + offset;
    // Strictly ascending hashes: a reader can search the cache without sorting it.
    if (previous && std::memcmp(previous, hash, 32) >= 0) return "entries not sorted";
    if (Little32(cache, offset + 32) & ~kTrustEntryKnownFlags) return "unknown entry flags";
    previous = hash;
  }
  return {};
}

std::vector<uint8_t> BuildTrustCache(std::vector<TrustCacheEntry> entries) {
  std::sort(entries.begin(), entries.end(), [](const auto& a, const auto& b) { return a.hash < b.hash; });
  entries.erase(std::unique(entries.begin(), entries.end(),
                            [](const auto& a, const auto& b) { return a.hash == b.hash; }),
                entries.end());
  std::vector<uint8_t> out;
  out.reserve(kTrustCacheHeaderSize + entries.size() * kTrustCacheEntrySize);
  PutLittle32(out, kTrustCacheMagic);
  PutLittle32(out, kTrustCacheVersion);
  PutLittle32(out, static_cast<uint32_t>(entries.size()));
  PutLittle32(out, 0);
  for (const auto& entry : entries) {
    out.insert(out.end(), entry.hash.begin(), entry.hash.end());
    PutLittle32(out, entry.flags & kTrustEntryKnownFlags);
  }
  return out;
}

}  // namespace brisvale::formats
