// The OpenSSL work of the imgtool: file and buffer digests, and signatures over a
// digest with a PEM private key (RSA PKCS#1 v1.5 with the digest's DigestInfo, or ECDSA).
#pragma once

#include <openssl/evp.h>

#include <string>

#include "imgtool/options.h"

namespace brisvale::imgtool {

const EVP_MD* DigestNamed(const std::string& name);  // "sha1", "sha256", "sha384"
Bytes DigestOfFile(const std::string& path, const EVP_MD* md);
Bytes DigestOfBytes(const Bytes& bytes, const EVP_MD* md);
Bytes SignDigest(const std::string& keyPath, const EVP_MD* md, const Bytes& digest);

}  // namespace brisvale::imgtool
