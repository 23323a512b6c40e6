// Fixtures for the verification tests: a scratch directory, file helpers, the signing
// tool, and certificates minted from the development PKI with chosen defects.
#pragma once

#include <openssl/evp.h>

#include <cstdint>
#include <filesystem>
#include <string>
#include <vector>

#include "test_files.h"

namespace brisvale::testing {

using Bytes = std::vector<uint8_t>;

std::string Pki(const std::string& name);  // a file of the development PKI
inline Bytes ReadBytes(const std::filesystem::path& path) { return ReadFileBytes(path); }
inline void WriteBytes(const std::filesystem::path& path, const Bytes& bytes) { WriteFileBytes(path, bytes); }

// Runs brisvale-imgtool with the arguments; true when it exits 0.
bool RunImgtool(const std::vector<std::string>& args);

// A certificate signed by `issuerKey` (PEM file) with the issuer name taken from
// `issuerCertificate` (DER file), for the public key of `subjectKey`.
struct CertificateRecipe {
  std::string issuerKey;
  std::string issuerCertificate;
  std::string subjectKey;
  std::string commonName = "Brisvale Test Leaf";
  const EVP_MD* digest = EVP_sha384();
  std::string notBefore = "20100101000000Z";
  std::string notAfter = "20400101000000Z";
  size_t paddingExtensionSize = 0;  // a private filler extension of this many bytes
};
Bytes MintCertificate(const CertificateRecipe& recipe);

// The to-be-signed part of a DER certificate, and a certificate around an edited one,
// signed again by `issuerKey` with `digest` and the matching RSA signature algorithm.
Bytes ToBeSigned(const Bytes& certificate);
Bytes Resign(const Bytes& toBeSigned, const std::string& issuerKey, const EVP_MD* digest);

// Replaces the only occurrence of `from` (hex) with `to` (hex, same length).
Bytes ReplaceOnce(const Bytes& bytes, const std::string& fromHex, const std::string& toHex);
Bytes FromHex(const std::string& hex);

// PKCS#1 RSAPublicKey of a PEM key. Signatures come from imgtool::SignDigest, the code
// the image builders sign with.
Bytes RsaPublicKeyOf(const std::string& keyPath);

}  // namespace brisvale::testing
