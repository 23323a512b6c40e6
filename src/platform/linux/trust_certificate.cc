// PEM certificates and RSA verification with a certificate's key, over OpenSSL 3.
#include <openssl/pem.h>
#include <openssl/rsa.h>

#include <climits>

#include "platform/crypto.h"
#include "platform/linux/trust_impl.h"

namespace brisvale::certtrust {

std::optional<Certificate> CreateCertificateFromPEM(std::span<const uint8_t> pem) {
  if (pem.empty() || pem.size() > INT_MAX) return std::nullopt;
  openssl::BioPtr bio(BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size())));
  if (!bio) return std::nullopt;
  openssl::X509Ptr x509(PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr));
  if (!x509) return std::nullopt;
  auto impl = std::make_shared<Certificate::Impl>();
  impl->x509 = std::move(x509);
  return Certificate(std::move(impl));
}

std::optional<Policy> CreateBasicX509Policy() { return Policy{}; }

bool VerifyRawRsaPkcs1Sha1(const PublicKey& key, std::span<const uint8_t> sha1Digest,
                           std::span<const uint8_t> signature) {
  EVP_PKEY* pkey = key.impl().key.get();
  if (!pkey || EVP_PKEY_get_base_id(pkey) != EVP_PKEY_RSA ||
      sha1Digest.size() != crypto::kSha1Length || signature.empty()) {
    return false;
  }
  openssl::PkeyCtxPtr ctx(EVP_PKEY_CTX_new_from_pkey(nullptr, pkey, nullptr));
  return ctx && EVP_PKEY_verify_init(ctx.get()) == 1 &&
         EVP_PKEY_CTX_set_rsa_padding(ctx.get(), RSA_PKCS1_PADDING) == 1 &&
         EVP_PKEY_CTX_set_signature_md(ctx.get(), EVP_sha1()) == 1 &&
         EVP_PKEY_verify(ctx.get(), signature.data(), signature.size(), sha1Digest.data(),
                         sha1Digest.size()) == 1;
}

}  // namespace brisvale::certtrust
