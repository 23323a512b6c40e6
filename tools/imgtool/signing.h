// The OpenSSL work of the imgtool: file and buffer digests, and signatures over a
// digest with a PEM private key (RSA PKCS#1 v1.5 with the digest's DigestInfo, or ECDSA).
#pragma once

#include <openssl/evp.h>

#include <string>

#include "imgtool/options.h"
#include "platform/linux/openssl_handles.h"

namespace brisvale::imgtool {

openssl::PkeyPtr LoadPrivateKey(const std::string& keyPath);  // a PEM private key

const EVP_MD* DigestNamed(const std::string& name);  // "sha1", "sha256", "sha384"
Bytes DigestOfFile(const std::string& path, const EVP_MD* md);
Bytes DigestOfBytes(const Bytes& bytes, const EVP_MD* md);
Bytes SignDigest(const std::string& keyPath, const EVP_MD* md, const Bytes& digest);

}  // namespace brisvale::imgtool

namespace brisvale::imgtool {

// A leaf certificate for the public key of `leafKey`, issued by the certificate
// `issuerCertificate` (DER file) with `issuerKey` and `md`, carrying an extension with
// OID content `oidContent` and value `extensionValue`. Valid 2010-2040.
Bytes MintLeafCertificate(const std::string& issuerKey, const std::string& issuerCertificate,
                          const std::string& leafKey, const EVP_MD* md, const Bytes& oidContent,
                          const Bytes& extensionValue);

}  // namespace brisvale::imgtool
