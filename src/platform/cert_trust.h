// X.509 certificate services: certificates from PEM, path validation against chosen
// anchors at a chosen instant, the evaluated certificate's public key, and raw RSA
// verification with that key. The developer-image signature check drives these.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <utility>
#include <vector>

namespace brisvale::certtrust {

// A parsed certificate; copies share it.
class Certificate {
 public:
  struct Impl;
  explicit Certificate(std::shared_ptr<const Impl> impl) : impl_(std::move(impl)) {}
  const Impl& impl() const { return *impl_; }

 private:
  std::shared_ptr<const Impl> impl_;
};

// A public key taken from a certificate; copies share it.
class PublicKey {
 public:
  struct Impl;
  explicit PublicKey(std::shared_ptr<const Impl> impl) : impl_(std::move(impl)) {}
  const Impl& impl() const { return *impl_; }

 private:
  std::shared_ptr<const Impl> impl_;
};

// The first PEM certificate in `pem`; none for bad PEM or a bad certificate.
std::optional<Certificate> CreateCertificateFromPEM(std::span<const uint8_t> pem);

// The basic X.509 policy: path and signature checks only, no host name or usage.
struct Policy {
  bool basicX509 = true;
};
std::optional<Policy> CreateBasicX509Policy();

// Trust-result codes, numbered as the platform numbers them.
enum class TrustResult : int {
  Invalid = 0,
  Proceed = 1,
  Deny = 3,
  Unspecified = 4,         // the chain verifies and nobody said otherwise: trusted
  RecoverableFailure = 5,  // the chain does not verify
  FatalFailure = 6,
  OtherError = 7,
};

// One evaluation: the first certificate is the one evaluated, the others are
// candidates for its chain. Only certificates given as anchors are trusted roots (an
// anchor need not be self-signed); with no anchors nothing is trusted.
class Trust {
 public:
  ~Trust();
  Trust(Trust&&) noexcept;
  Trust& operator=(Trust&&) noexcept;

  static std::optional<Trust> Create(const std::vector<Certificate>& certificates,
                                     const Policy& policy);
  bool SetAnchorCertificates(const std::vector<Certificate>& anchors);
  // Validity is judged as of this instant (Unix time) instead of the current time.
  bool SetVerifyDate(int64_t unixTime);
  // False when the evaluation could not run; otherwise `result` says the verdict.
  bool Evaluate(TrustResult* result);
  // The evaluated certificate's key; none before a trusted evaluation.
  std::optional<PublicKey> CopyPublicKey() const;

 private:
  struct State;
  explicit Trust(std::unique_ptr<State> state);
  std::unique_ptr<State> state_;
};

// RSASSA-PKCS1-v1_5 with a SHA-1 DigestInfo over a 20-byte digest the caller computed
// (the platform's padding selector 0x8002). False for a non-RSA key or a bad signature.
bool VerifyRawRsaPkcs1Sha1(const PublicKey& key, std::span<const uint8_t> sha1Digest,
                           std::span<const uint8_t> signature);

}  // namespace brisvale::certtrust
