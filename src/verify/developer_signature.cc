#include "verify/developer_signature.h"

#include <cerrno>
#include <cmath>
#include <memory>
#include <new>
#include <string>
#include <vector>

#include "base/log.h"
#include "base/unique_fd.h"
#include "platform/os.h"
#include "platform/services.h"

namespace brisvale::verify {

std::optional<certtrust::Certificate> CopyCertificateFromPEMFile(std::string_view path) {
  if (path.empty() || path.size() >= os::kPathBufferSize) {
    Log(Level::Default, "Failed to create string.");
    return std::nullopt;
  }
  os::Os& os = *CurrentServices().os;
  std::string pathText(path);
  const int fd = os.OpenFile(pathText.c_str());
  if (fd < 0) {
    Log(Level::Default, "Failed to open %s: %{errno}d", pathText, -fd);
    return std::nullopt;
  }
  const UniqueFd file(fd);
  uint64_t fileSize = 0;
  if (const int rc = os.FileSize(file.get(), fileSize); rc < 0) {
    Log(Level::Default, "Failed to fstat %s: %{errno}d", pathText, -rc);
    return std::nullopt;
  }
  const size_t size = static_cast<size_t>(fileSize);
  std::unique_ptr<uint8_t[]> bytes(new (std::nothrow) uint8_t[size ? size : 1]);
  if (!bytes) {
    Log(Level::Default, "Failed to allocate memory: %{errno}d", ENOMEM);
    return std::nullopt;
  }
  const int64_t count = os.Read(file.get(), {bytes.get(), size}, 0);
  if (count < 0 || static_cast<size_t>(count) != size) {
    Log(Level::Default, "Failed to read %s: %{errno}d", pathText, count < 0 ? static_cast<int>(-count) : 0);
    return std::nullopt;
  }
  std::optional<certtrust::Certificate> certificate =
      certtrust::CreateCertificateFromPEM({bytes.get(), size});
  if (!certificate) Log(Level::Default, "Failed to create certificate with PEM data.");
  return certificate;
}

std::optional<certtrust::PublicKey> CopyTrustedPublicKey(
    const certtrust::Certificate& certificate, std::string_view caPath) {
  std::optional<certtrust::Certificate> ca = CopyCertificateFromPEMFile(caPath);
  if (!ca) {
    Log(Level::Default, "Failed to load %@.", caPath);
    return std::nullopt;
  }
  std::vector<certtrust::Certificate> certificates{certificate, *ca};
  std::optional<certtrust::Policy> policy = certtrust::CreateBasicX509Policy();
  if (!policy) {
    Log(Level::Default, "Failed to create basic X509 policy.");
    return std::nullopt;
  }
  std::optional<certtrust::Trust> trust = certtrust::Trust::Create(certificates, *policy);
  if (!trust || !trust->SetAnchorCertificates({*ca})) {
    Log(Level::Default, "Failed to create trust with policy.");
    return std::nullopt;
  }
  const int64_t verifyTime =
      kReferenceDateUnixTime + static_cast<int64_t>(std::floor(kVerificationDateSinceReferenceDate));
  if (!trust->SetVerifyDate(verifyTime)) {
    Log(Level::Default, "Failed to set trust verify date.");
    return std::nullopt;
  }
  certtrust::TrustResult result = certtrust::TrustResult::Invalid;
  bool evaluated = trust->Evaluate(&result);
  if (!evaluated || (result != certtrust::TrustResult::Proceed &&
                     result != certtrust::TrustResult::Unspecified)) {
    Log(Level::Default, "Failed to evaluate trust: %d", static_cast<int>(result));
    return std::nullopt;
  }
  std::optional<certtrust::PublicKey> key = trust->CopyPublicKey();
  if (!key) Log(Level::Default, "Failed to copy the public key from the trust.");
  return key;
}

int VerifyDeveloperImageSignature(std::span<const uint8_t> signature,
                                  std::string_view certificatePath,
                                  std::span<const uint8_t> sha1Digest,
                                  std::string_view caPath) {
  std::optional<certtrust::Certificate> certificate = CopyCertificateFromPEMFile(certificatePath);
  if (!certificate) {
    Log(Level::Default, "Failed to load the certificate at %@.", certificatePath);
    return -1;
  }
  std::optional<certtrust::PublicKey> key = CopyTrustedPublicKey(*certificate, caPath);
  if (!key) {
    Log(Level::Default, "Failed to extract public key from the certificate.");
    return -1;
  }
  if (!certtrust::VerifyRawRsaPkcs1Sha1(*key, sha1Digest, signature)) {
    Log(Level::Default, "Failed to validate signature.");
    return -1;
  }
  return 0;
}

}  // namespace brisvale::verify
