// The developer-image check: image file digests, the certificate files, trust at the fixed
// instant and the RSA signature.
#include "verify/developer_signature.h"

#include <gtest/gtest.h>

#include "base/log.h"
#include "imgtool/signing.h"
#include "test_support.h"
#include "verify/image_digest.h"

namespace brisvale::verify {
namespace {

using testing::Bytes;
using testing::Pki;
using Lines = std::vector<std::string>;

// Sizes around the read buffer catch a dropped or repeated last block.
TEST(DigestImageFile, MatchesOneShotDigestAtBufferBoundaries) {
  testing::ScratchDir dir;
  for (size_t size : {size_t{0}, kDigestReadSize - 1, kDigestReadSize, 2 * kDigestReadSize + 7}) {
    Bytes data(size);
    for (size_t i = 0; i < size; ++i) data[i] = static_cast<uint8_t>(i * 31 + size);
    testing::WriteFileBytes(dir / "image", data);
    for (auto [length, md] : {std::pair{20L, EVP_sha1()}, std::pair{48L, EVP_sha384()}}) {
      std::vector<uint8_t> digest;
      ASSERT_EQ(DigestImageFile((dir / "image").string(), &digest, length), 0) << size;
      EXPECT_EQ(digest, imgtool::DigestOfBytes(data, md)) << size << " " << length;
    }
  }
}

TEST(DigestImageFile, FailuresLogWhy) {
  testing::ScratchDir dir;
  testing::WriteFileBytes(dir / "image", {1, 2, 3});
  const std::string image = (dir / "image").string(), missing = (dir / "missing").string();
  struct Case { std::string path; long length; bool withOutput; Lines lines; } cases[] = {
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

TEST(VerifyDeveloperImageSignature, TrustAtTheFixedInstantThenTheSignature) {
  testing::ScratchDir dir;
  Bytes image(300000);
  for (size_t i = 0; i < image.size(); ++i) image[i] = static_cast<uint8_t>(i % 251);
  testing::WriteFileBytes(dir / "image", image);
  image[123456] ^= 1;
  testing::WriteFileBytes(dir / "tampered", image);
  const std::string missingCa = (dir / "no-ca.pem").string();
  const std::string missingCertificate = (dir / "no-cert.pem").string();
  const std::string derCertificate = Pki("developer-ca.der"), longPath(1024, 'a');
  auto notLoaded = [](const std::string& path) { return "Failed to load the certificate at " + path + "."; };
  const Lines untrusted = {"Failed to evaluate trust: 5",
                           "Failed to extract public key from the certificate."};
  // `lines`: none when the signature is accepted; `key` signs `image`.
  struct Case {
    std::string certificate = Pki("developer-signing.pem"); Lines lines = {};
    std::string ca = Pki("developer-ca.pem"); const char* image = "image";
    const char* key = "developer-signing.key";
  } cases[] = {
      {},
      // Expired long after 2014-04-10: still trusted then.
      {.certificate = Pki("developer-signing-expired.pem")},
      // Not yet valid at 2014-04-10, though valid today.
      {.certificate = Pki("developer-signing-future.pem"), .lines = untrusted},
      // A valid signature from a certificate of another CA.
      {.certificate = Pki("foreign-signing.pem"), .lines = untrusted, .key = "foreign-signing.key"},
      {.lines = {"Failed to validate signature."}, .image = "tampered"},
      // Missing files fail before any trust work.
      {.lines = {"Failed to open " + missingCa + ": 2", "Failed to load " + missingCa + ".",
                 "Failed to extract public key from the certificate."},
       .ca = missingCa},
      {.certificate = missingCertificate,
       .lines = {"Failed to open " + missingCertificate + ": 2", notLoaded(missingCertificate)}},
      // Not PEM, and a path longer than a path can be.
      {.certificate = derCertificate,
       .lines = {"Failed to create certificate with PEM data.", notLoaded(derCertificate)}},
      {.certificate = longPath, .lines = {"Failed to create string.", notLoaded(longPath)}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.certificate + " " + c.ca);
    const std::string signature = (dir / "signature").string();
    ASSERT_TRUE(testing::RunImgtool({"sign-developer", "--key", Pki(c.key), "--image",
                                     (dir / "image").string(), "-o", signature}));
    const std::optional<plist::Bytes> digest = DigestFileSha1((dir / c.image).string());
    ASSERT_TRUE(digest);
    log::CaptureSink capture;
    EXPECT_EQ(VerifyDeveloperImageSignature(testing::ReadFileBytes(signature), c.certificate, *digest, c.ca),
              c.lines.empty() ? 0 : -1);
    EXPECT_EQ(capture.Texts(), c.lines);
  }
}

}  // namespace
}  // namespace brisvale::verify
