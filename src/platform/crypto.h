// Cryptographic primitives by algorithm: message digests (one-shot and streaming) and
// signature verification. Byte ranges in, flags out; nothing here parses certificates.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <span>

namespace brisvale::crypto {

enum class DigestAlgorithm { Sha1, Sha256, Sha384 };

inline constexpr size_t kSha1Length = 20;
inline constexpr size_t kSha256Length = 32;
inline constexpr size_t kSha384Length = 48;
inline constexpr size_t kMaxDigestLength = kSha384Length;

constexpr size_t DigestLength(DigestAlgorithm algorithm) {
  switch (algorithm) {
    case DigestAlgorithm::Sha1: return kSha1Length;
    case DigestAlgorithm::Sha256: return kSha256Length;
    case DigestAlgorithm::Sha384: return kSha384Length;
  }
  return 0;
}

// Writes DigestLength(algorithm) bytes to `out`; false when `out` is too small or the
// library fails.
bool Digest(DigestAlgorithm algorithm, std::span<const uint8_t> input, std::span<uint8_t> out);

// Streaming digest. A failed step makes every later step and Finish fail.
class Hasher {
 public:
  explicit Hasher(DigestAlgorithm algorithm);
  ~Hasher();
  Hasher(const Hasher&) = delete;
  Hasher& operator=(const Hasher&) = delete;

  bool Update(std::span<const uint8_t> input);
  bool Finish(std::span<uint8_t> out);
  DigestAlgorithm algorithm() const { return algorithm_; }

 private:
  struct State;
  DigestAlgorithm algorithm_;
  std::unique_ptr<State> state_;
};

// --- Signature verification ---------------------------------------------------------
// (declared by the verification layer that needs them)

}  // namespace brisvale::crypto
