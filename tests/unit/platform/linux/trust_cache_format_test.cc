// The trust-cache structure check against caches built and then damaged one field at
// a time.
#include <gtest/gtest.h>

#include <functional>

#include "platform/linux/format_trust_cache.h"

namespace brisvale::formats {
namespace {

TrustCacheEntry Entry(uint8_t first) {
  TrustCacheEntry entry;
  entry.hash.fill(0xAA);
  entry.hash[0] = first;
  return entry;
}

TEST(TrustCacheFormatTest, BuiltCachesPassAndEachDamageIsNamed) {
  const std::vector<uint8_t> built = BuildTrustCache({Entry(3), Entry(1), Entry(3), Entry(2)});
  EXPECT_EQ(built.size(), kTrustCacheHeaderSize + 3 * kTrustCacheEntrySize);  // sorted, deduplicated
  EXPECT_EQ(CheckTrustCache(built), "");
  EXPECT_EQ(CheckTrustCache(BuildTrustCache({})), "");

  struct Case {
    const char* problem;
    std::function<void(std::vector<uint8_t>&)> damage;
  } cases[] = {
      {"shorter than its header", [](auto& cache) { cache.resize(15); }},
      {"bad magic", [](auto& cache) { cache[0] ^= 1; }},
      {"unknown version", [](auto& cache) { cache[4] = 2; }},
      {"reserved field set", [](auto& cache) { cache[15] = 1; }},
      {"too many entries", [](auto& cache) { cache[11] = 0x10; }},
      {"size does not match the entry count", [](auto& cache) { cache.push_back(0); }},
      {"entries not sorted", [](auto& cache) { cache[16 + 36] = 1; }},  // a duplicate
      {"unknown entry flags", [](auto& cache) { cache[16 + 33] = 1; }},
  };
  for (const Case& c : cases) {
    std::vector<uint8_t> cache = built;
    c.damage(cache);
    EXPECT_EQ(CheckTrustCache(cache), c.problem);
  }
}

}  // namespace
}  // namespace brisvale::formats
