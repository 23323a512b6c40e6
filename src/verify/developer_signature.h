// The developer and factory image check: an RSA PKCS#1 v1.5 signature over the image's
// SHA-1 digest, made with the key of a signing certificate kept on the device that
// chains to the device's CA certificate. Trust is judged as of one fixed instant, never
// the current time, so a device with a wrong clock accepts the same images.
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string_view>

#include "platform/cert_trust.h"

namespace brisvale::verify {

inline constexpr std::string_view kDeveloperCAPath = "/System/Library/Tethra/CorvexCA.pem";
inline constexpr std::string_view kDeveloperSigningCertificatePath =
    "/System/Library/Tethra/CorvexDebug.pem";

// 2014-04-10 22:55:30 UTC: 418863330 s after 2001-01-01, the platform's reference date.
inline constexpr double kVerificationDateSinceReferenceDate = 418863330.0;
inline constexpr int64_t kReferenceDateUnixTime = 978307200;

// The first certificate of a PEM file, or none after logging why.
std::optional<certtrust::Certificate> CopyCertificateFromPEMFile(std::string_view path);

// The certificate's public key when it chains to the CA certificate at `caPath` (its
// only anchor) at the fixed instant, or none after logging why.
std::optional<certtrust::PublicKey> CopyTrustedPublicKey(
    const certtrust::Certificate& certificate, std::string_view caPath = kDeveloperCAPath);

// 0 when `signature` is the signing certificate's signature over `sha1Digest`; -1 after
// logging why.
int VerifyDeveloperImageSignature(std::span<const uint8_t> signature,
                                  std::string_view certificatePath,
                                  std::span<const uint8_t> sha1Digest,
                                  std::string_view caPath = kDeveloperCAPath);

}  // namespace brisvale::verify
