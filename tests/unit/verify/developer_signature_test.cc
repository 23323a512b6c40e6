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

class DeveloperSignatureTest : public ::testing::Test {
 protected:
  void SetUp() override {
    Bytes image(300000);
    for (size_t i = 0; i < image.size(); ++i) image[i] = static_cast<uint8_t>(i % 251);
    testing::WriteBytes(dir_ / "image", image);
    image[123456] ^= 1;
    testing::WriteBytes(dir_ / "tampered", image);
  }

  Bytes Sign(const std::string& key) {
    std::string out = (dir_ / "signature").string();
    EXPECT_TRUE(testing::RunImgtool(
        {"sign-developer", "--key", Pki(key), "--image", (dir_ / "image").string(), "-o", out}));
    return testing::ReadBytes(out);
  }

  Bytes Digest(const std::string& name) {
    std::optional<plist::Bytes> digest = DigestFileSha1((dir_ / name).string());
    EXPECT_TRUE(digest);
    return digest.value_or(Bytes{});
  }

  testing::ScratchDir dir_;
};

TEST_F(DeveloperSignatureTest, TrustIsJudgedAtTheFixedInstant) {
  struct Case {
    const char* key;
    const char* certificate;
    int result;
  } cases[] = {
      {"developer-signing.key", "developer-signing.pem", 0},
      // Expired long after 2014-04-10: still trusted then.
      {"developer-signing.key", "developer-signing-expired.pem", 0},
      // Not yet valid at 2014-04-10, though valid today.
      {"developer-signing.key", "developer-signing-future.pem", -1},
      // A valid signature from a certificate of another CA.
      {"foreign-signing.key", "foreign-signing.pem", -1},
  };
  for (const Case& c : cases) {
    log::CaptureSink capture;
    EXPECT_EQ(VerifyDeveloperImageSignature(Sign(c.key), Pki(c.certificate), Digest("image"),
                                            Pki("developer-ca.pem")),
              c.result)
        << c.certificate;
    if (c.result != 0) {
      EXPECT_EQ(capture.Texts(), (std::vector<std::string>{
                                     "Failed to evaluate trust: 5",
                                     "Failed to extract public key from the certificate."}));
    }
  }
}

TEST_F(DeveloperSignatureTest, SignatureCoversTheImageBytes) {
  log::CaptureSink capture;
  EXPECT_EQ(VerifyDeveloperImageSignature(Sign("developer-signing.key"), Pki("developer-signing.pem"),
                                          Digest("tampered"), Pki("developer-ca.pem")),
            -1);
  EXPECT_EQ(capture.Texts(), std::vector<std::string>{"Failed to validate signature."});
}

TEST_F(DeveloperSignatureTest, MissingFilesFailBeforeAnyTrustWork) {
  std::string missingCa = (dir_ / "no-ca.pem").string();
  std::string missingCertificate = (dir_ / "no-cert.pem").string();
  Bytes signature = Sign("developer-signing.key");
  {
    log::CaptureSink capture;
    EXPECT_EQ(VerifyDeveloperImageSignature(signature, Pki("developer-signing.pem"),
                                            Digest("image"), missingCa),
              -1);
    EXPECT_EQ(capture.Texts(), (std::vector<std::string>{
                                   "Failed to open " + missingCa + ": 2",
                                   "Failed to load " + missingCa + ".",
                                   "Failed to extract public key from the certificate."}));
  }
  {
    log::CaptureSink capture;
    EXPECT_EQ(VerifyDeveloperImageSignature(signature, missingCertificate, Digest("image"),
                                            Pki("developer-ca.pem")),
              -1);
    EXPECT_EQ(capture.Texts(), (std::vector<std::string>{
                                   "Failed to open " + missingCertificate + ": 2",
                                   "Failed to load the certificate at " + missingCertificate + "."}));
  }
}

TEST(CopyCertificateFromPEMFile, RefusesWhatIsNotAPemCertificate) {
  testing::ScratchDir dir;
  testing::WriteBytes(dir / "der", testing::ReadBytes(Pki("developer-ca.der")));
  testing::WriteBytes(dir / "empty", {});
  for (const char* name : {"der", "empty"}) {
    log::CaptureSink capture;
    EXPECT_FALSE(CopyCertificateFromPEMFile((dir / name).string())) << name;
    EXPECT_EQ(capture.Texts(),
              std::vector<std::string>{"Failed to create certificate with PEM data."});
  }
  log::CaptureSink capture;
  EXPECT_FALSE(CopyCertificateFromPEMFile(std::string(1024, 'a')));
  EXPECT_EQ(capture.Texts(), std::vector<std::string>{"Failed to create string."});
}

}  // namespace
}  // namespace brisvale::verify
