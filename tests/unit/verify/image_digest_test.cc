// Image file digests: SHA-1 and SHA-384 chosen by length, and the failure lines.
#include "verify/image_digest.h"

#include <gtest/gtest.h>

#include "base/log.h"
#include "platform/crypto.h"
#include "test_support.h"

namespace brisvale::verify {
namespace {

using testing::Bytes;

Bytes Expected(crypto::DigestAlgorithm algorithm, const Bytes& data) {
  Bytes digest(crypto::DigestLength(algorithm));
  EXPECT_TRUE(crypto::Digest(algorithm, data, digest));
  return digest;
}

// Sizes around the read buffer catch a dropped or repeated last block.
TEST(DigestImageFile, MatchesOneShotDigestAtBufferBoundaries) {
  testing::ScratchDir dir;
  for (size_t size : {size_t{0}, kDigestReadSize - 1, kDigestReadSize, 2 * kDigestReadSize + 7}) {
    Bytes data(size);
    for (size_t i = 0; i < size; ++i) data[i] = static_cast<uint8_t>(i * 31 + size);
    testing::WriteFileBytes(dir / "image", data);
    for (auto [length, algorithm] : {std::pair{20L, crypto::DigestAlgorithm::Sha1},
                                     std::pair{48L, crypto::DigestAlgorithm::Sha384}}) {
      std::vector<uint8_t> digest;
      ASSERT_EQ(DigestImageFile((dir / "image").string(), &digest, length), 0) << size;
      EXPECT_EQ(digest, Expected(algorithm, data)) << size << " " << length;
    }
  }
}

TEST(DigestImageFile, FailuresLogWhy) {
  testing::ScratchDir dir;
  testing::WriteFileBytes(dir / "image", {1, 2, 3});
  std::string image = (dir / "image").string();
  std::string missing = (dir / "missing").string();
  struct Case { std::string path; long length; bool withOutput; std::vector<std::string> lines; } cases[] = {
      {image, 32, true, {"Unsupported digest size: 32", "Failed to digest data."}},
      {image, 20, false, {"Invalid input"}},
      {missing, 20, true,
       {"Failed to create file handle for " + missing + ".", "Failed to digest data."}},
      {"", 48, true, {"Invalid input.", "Failed to digest data."}},
  };
  for (const Case& c : cases) {
    log::CaptureSink capture;
    std::vector<uint8_t> digest;
    EXPECT_EQ(DigestImageFile(c.path, c.withOutput ? &digest : nullptr, c.length), -1);
    EXPECT_EQ(capture.Texts(), c.lines) << c.path << " " << c.length;
  }
}

}  // namespace
}  // namespace brisvale::verify
