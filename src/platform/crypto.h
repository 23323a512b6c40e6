// Cryptographic primitives by algorithm: message digests (one-shot and streaming) and
// signature verification. Byte ranges in, flags out; nothing here parses certificates.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
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
// Each check is true only when the library ran the verification and it reported a
// valid signature; malformed keys, unsupported sizes and library errors are false.

// Largest RSA modulus the verifiers load: 4096 bits.
inline constexpr size_t kMaxRsaModulusBytes = 512;

// RSASSA-PKCS1-v1_5 over a digest computed by the caller, with the DigestInfo of
// `algorithm`. Modulus and exponent are unsigned big-endian integers (leading zero
// bytes allowed); a modulus above kMaxRsaModulusBytes significant bytes, or an exponent
// longer than the modulus, is refused. `digest` must be DigestLength(algorithm) bytes.
bool VerifyRsaPkcs1(std::span<const uint8_t> modulus, std::span<const uint8_t> exponent,
                    DigestAlgorithm algorithm, std::span<const uint8_t> digest,
                    std::span<const uint8_t> signature);

// Named prime curves, chosen by the size of an uncompressed X9.63 point (04 || X || Y).
enum class EcCurve { P256, P384, P521 };
std::optional<EcCurve> EcCurveForPointSize(size_t pointSize);

// ECDSA over a digest computed by the caller: `point` is an uncompressed X9.63 public
// key whose size selects the curve; `signature` is the DER ECDSA-Sig-Value.
bool VerifyEcdsa(std::span<const uint8_t> point, std::span<const uint8_t> digest,
                 std::span<const uint8_t> signature);

}  // namespace brisvale::crypto
