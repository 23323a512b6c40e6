#include "imgtool/signing.h"

#include <openssl/pem.h>
#include <openssl/rsa.h>

#include <cstdio>
#include <fstream>
#include <memory>

namespace brisvale::imgtool {
namespace {

template <auto Free>
struct Deleter {
  template <typename T>
  void operator()(T* object) const { Free(object); }
};

}  // namespace

const EVP_MD* DigestNamed(const std::string& name) {
  if (name == "sha1") return EVP_sha1();
  if (name == "sha256") return EVP_sha256();
  if (name == "sha384") return EVP_sha384();
  throw ToolError("unknown digest: " + name, true);
}

Bytes DigestOfFile(const std::string& path, const EVP_MD* md) {
  std::ifstream file(path, std::ios::binary);
  if (!file) throw ToolError("cannot open " + path);
  std::unique_ptr<EVP_MD_CTX, Deleter<EVP_MD_CTX_free>> ctx(EVP_MD_CTX_new());
  if (!ctx || EVP_DigestInit_ex(ctx.get(), md, nullptr) != 1) throw ToolError("digest failed");
  std::vector<char> buffer(1 << 20);
  while (file) {
    file.read(buffer.data(), static_cast<std::streamsize>(buffer.size()));
    if (file.gcount() > 0 &&
        EVP_DigestUpdate(ctx.get(), buffer.data(), static_cast<size_t>(file.gcount())) != 1) {
      throw ToolError("digest failed");
    }
  }
  if (file.bad()) throw ToolError("cannot read " + path);
  Bytes digest(static_cast<size_t>(EVP_MD_get_size(md)));
  if (EVP_DigestFinal_ex(ctx.get(), digest.data(), nullptr) != 1) throw ToolError("digest failed");
  return digest;
}

Bytes DigestOfBytes(const Bytes& bytes, const EVP_MD* md) {
  Bytes digest(static_cast<size_t>(EVP_MD_get_size(md)));
  if (EVP_Digest(bytes.data(), bytes.size(), digest.data(), nullptr, md, nullptr) != 1) {
    throw ToolError("digest failed");
  }
  return digest;
}

Bytes SignDigest(const std::string& keyPath, const EVP_MD* md, const Bytes& digest) {
  std::unique_ptr<FILE, Deleter<fclose>> file(std::fopen(keyPath.c_str(), "rb"));
  if (!file) throw ToolError("cannot open key " + keyPath);
  std::unique_ptr<EVP_PKEY, Deleter<EVP_PKEY_free>> key(
      PEM_read_PrivateKey(file.get(), nullptr, nullptr, nullptr));
  if (!key) throw ToolError("not a PEM private key: " + keyPath);
  std::unique_ptr<EVP_PKEY_CTX, Deleter<EVP_PKEY_CTX_free>> ctx(
      EVP_PKEY_CTX_new(key.get(), nullptr));
  if (!ctx || EVP_PKEY_sign_init(ctx.get()) != 1 ||
      EVP_PKEY_CTX_set_signature_md(ctx.get(), md) != 1) {
    throw ToolError("cannot sign with " + keyPath);
  }
  if (EVP_PKEY_get_base_id(key.get()) == EVP_PKEY_RSA &&
      EVP_PKEY_CTX_set_rsa_padding(ctx.get(), RSA_PKCS1_PADDING) != 1) {
    throw ToolError("cannot sign with " + keyPath);
  }
  size_t length = 0;
  if (EVP_PKEY_sign(ctx.get(), nullptr, &length, digest.data(), digest.size()) != 1) {
    throw ToolError("cannot sign with " + keyPath);
  }
  Bytes signature(length);
  if (EVP_PKEY_sign(ctx.get(), signature.data(), &length, digest.data(), digest.size()) != 1) {
    throw ToolError("signing failed with " + keyPath);
  }
  signature.resize(length);
  return signature;
}

}  // namespace brisvale::imgtool
