// The developer-image signature check: certificate files, trust at the fixed instant, the RSA signature.
#include "verify/developer_signature.h"

#include <gtest/gtest.h>

#include "base/log.h"
#include "test_support.h"
#include "verify/image_digest.h"

namespace brisvale::verify {
namespace {

using testing::Bytes;
using testing::Pki;
using Lines = std::vector<std::string>;

TEST(VerifyDeveloperImageSignature, TrustAtTheFixedInstantThenTheSignature) {
  testing::ScratchDir dir;
  Bytes image(300000);
  for (size_t i = 0; i < image.size(); ++i) image[i] = static_cast<uint8_t>(i % 251);
  testing::WriteFileBytes(dir / "image", image);
  image[123456] ^= 1;
  testing::WriteFileBytes(dir / "tampered", image);
  const std::string missingCa = (dir / "no-ca.pem").string();
  const std::string missingCertificate = (dir / "no-cert.pem").string();
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
       .lines = {"Failed to open " + missingCertificate + ": 2",
                 "Failed to load the certificate at " + missingCertificate + "."}},
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

TEST(CopyCertificateFromPEMFile, RefusesWhatIsNotAPemCertificate) {
  const std::pair<std::string, const char*> cases[] = {
      {Pki("developer-ca.der"), "Failed to create certificate with PEM data."},
      {std::string(1024, 'a'), "Failed to create string."},
  };
  for (const auto& [path, line] : cases) {
    log::CaptureSink capture;
    EXPECT_FALSE(CopyCertificateFromPEMFile(path)) << path;
    EXPECT_EQ(capture.Texts(), Lines{line}) << path;
  }
}

}  // namespace
}  // namespace brisvale::verify
