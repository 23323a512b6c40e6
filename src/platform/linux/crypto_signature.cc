// Signature verification over OpenSSL 3: keys are imported from raw components into
// EVP_PKEY objects and checked against a digest the caller already computed.
#include <openssl/core_names.h>
#include <openssl/params.h>
#include <openssl/rsa.h>

#include <algorithm>
#include <array>

#include "platform/crypto.h"
#include "platform/linux/openssl_handles.h"

namespace brisvale::crypto {
namespace {

std::span<const uint8_t> WithoutLeadingZeros(std::span<const uint8_t> number) {
  size_t skip = 0;
  while (skip < number.size() && number[skip] == 0) ++skip;
  return number.subspan(skip);
}

using openssl::MessageDigest;

openssl::PkeyPtr PublicKeyFromParams(const char* type, OSSL_PARAM* params) {
  openssl::PkeyCtxPtr ctx(EVP_PKEY_CTX_new_from_name(nullptr, type, nullptr));
  EVP_PKEY* key = nullptr;
  if (!ctx || EVP_PKEY_fromdata_init(ctx.get()) != 1 ||
      EVP_PKEY_fromdata(ctx.get(), &key, EVP_PKEY_PUBLIC_KEY, params) != 1) {
    return nullptr;
  }
  return openssl::PkeyPtr(key);
}

// EVP_PKEY_verify with the key's own context; `configure` sets padding and digest.
template <typename Configure>
bool VerifyDigest(EVP_PKEY* key, std::span<const uint8_t> digest,
                  std::span<const uint8_t> signature, Configure configure) {
  openssl::PkeyCtxPtr ctx(EVP_PKEY_CTX_new_from_pkey(nullptr, key, nullptr));
  if (!ctx || EVP_PKEY_verify_init(ctx.get()) != 1 || !configure(ctx.get())) return false;
  return EVP_PKEY_verify(ctx.get(), signature.data(), signature.size(), digest.data(),
                         digest.size()) == 1;
}

}  // namespace

bool VerifyRsaPkcs1(std::span<const uint8_t> modulus, std::span<const uint8_t> exponent,
                    DigestAlgorithm algorithm, std::span<const uint8_t> digest,
                    std::span<const uint8_t> signature) {
  modulus = WithoutLeadingZeros(modulus);
  exponent = WithoutLeadingZeros(exponent);
  if (modulus.empty() || modulus.size() > kMaxRsaModulusBytes || exponent.empty() ||
      exponent.size() > modulus.size() || signature.empty() ||
      digest.size() != DigestLength(algorithm)) {
    return false;
  }
  // OSSL_PARAM integers are in native byte order.
  std::array<uint8_t, kMaxRsaModulusBytes> n{};
  std::array<uint8_t, kMaxRsaModulusBytes> e{};
  std::reverse_copy(modulus.begin(), modulus.end(), n.begin());
  std::reverse_copy(exponent.begin(), exponent.end(), e.begin());
  OSSL_PARAM params[] = {
      OSSL_PARAM_construct_BN(OSSL_PKEY_PARAM_RSA_N, n.data(), modulus.size()),
      OSSL_PARAM_construct_BN(OSSL_PKEY_PARAM_RSA_E, e.data(), exponent.size()),
      OSSL_PARAM_construct_end(),
  };
  openssl::PkeyPtr key = PublicKeyFromParams("RSA", params);
  if (!key) return false;
  return VerifyDigest(key.get(), digest, signature, [algorithm](EVP_PKEY_CTX* ctx) {
    return EVP_PKEY_CTX_set_rsa_padding(ctx, RSA_PKCS1_PADDING) == 1 &&
           EVP_PKEY_CTX_set_signature_md(ctx, MessageDigest(algorithm)) == 1;
  });
}

std::optional<EcCurve> EcCurveForPointSize(size_t pointSize) {
  switch (pointSize) {
    case 1 + 2 * 32: return EcCurve::P256;
    case 1 + 2 * 48: return EcCurve::P384;
    case 1 + 2 * 66: return EcCurve::P521;
    default: return std::nullopt;
  }
}

bool VerifyEcdsa(std::span<const uint8_t> point, std::span<const uint8_t> digest,
                 std::span<const uint8_t> signature) {
  std::optional<EcCurve> curve = EcCurveForPointSize(point.size());
  if (!curve || point[0] != 0x04 || digest.empty() || signature.empty()) return false;
  const char* groupName = *curve == EcCurve::P256   ? "P-256"
                          : *curve == EcCurve::P384 ? "P-384"
                                                    : "P-521";
  OSSL_PARAM params[] = {
      OSSL_PARAM_construct_utf8_string(OSSL_PKEY_PARAM_GROUP_NAME,
                                       const_cast<char*>(groupName), 0),
      OSSL_PARAM_construct_octet_string(OSSL_PKEY_PARAM_PUB_KEY,
                                        const_cast<uint8_t*>(point.data()), point.size()),
      OSSL_PARAM_construct_end(),
  };
  openssl::PkeyPtr key = PublicKeyFromParams("EC", params);
  if (!key) return false;
  return VerifyDigest(key.get(), digest, signature, [](EVP_PKEY_CTX*) { return true; });
}

}  // namespace brisvale::crypto
