// The project's trust-cache format (docs/trust-cache.md): a 16-byte header, then
// fixed-size entries of a SHA-256 hash and flags, sorted by hash. Checking it is what
// the code-integrity service does before it keeps a cache; building it is what
// `brisvale-imgtool trust-cache` does.
#pragma once

#include <array>
#include <cstdint>
#include <span>
#include <string>
#include <vector>

namespace brisvale::formats {

inline constexpr uint32_t kTrustCacheMagic = 0x43545642;  // "BVTC" as little-endian bytes
inline constexpr uint32_t kTrustCacheVersion = 1;
inline constexpr size_t kTrustCacheHeaderSize = 16;
inline constexpr size_t kTrustCacheEntrySize = 36;
inline constexpr uint32_t kMaxTrustCacheEntries = 1 << 20;

// Entry flags; every other bit must be clear.
inline constexpr uint32_t kTrustEntryExecutable = 0x1;
inline constexpr uint32_t kTrustEntryKnownFlags = kTrustEntryExecutable;

struct TrustCacheEntry {
  std::array<uint8_t, 32> hash{};
  uint32_t flags = kTrustEntryExecutable;
};

// Empty when `cache` is well formed; otherwise why it is not, as a short phrase.
std::string CheckTrustCache(std::span<const uint8_t> cache);

// A well-formed cache of `entries` (sorted here, duplicates dropped).
std::vector<uint8_t> BuildTrustCache(std::vector<TrustCacheEntry> entries);

}  // namespace brisvale::formats
