#include "imgtool/signing.h"

#include <openssl/pem.h>
#include <openssl/rsa.h>
#include <openssl/x509.h>

#include <cstdio>
#include <fstream>
#include <memory>

namespace brisvale::imgtool {
namespace {

using openssl::PkeyPtr;

}  // namespace

PkeyPtr LoadPrivateKey(const std::string& keyPath) {
  CHandle<FILE, fclose> file(std::fopen(keyPath.c_str(), "rb"));
  if (!file) throw ToolError("cannot open key " + keyPath);
  PkeyPtr key(PEM_read_PrivateKey(file.get(), nullptr, nullptr, nullptr));
  if (!key) throw ToolError("not a PEM private key: " + keyPath);
  return key;
}

const EVP_MD* DigestNamed(const std::string& name) {
  if (name == "sha1") return EVP_sha1();
  if (name == "sha256") return EVP_sha256();
  if (name == "sha384") return EVP_sha384();
  throw ToolError("unknown digest: " + name, true);
}

Bytes DigestOfFile(const std::string& path, const EVP_MD* md) {
  std::ifstream file(path, std::ios::binary);
  if (!file) throw ToolError("cannot open " + path);
  openssl::MdCtxPtr ctx(EVP_MD_CTX_new());
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
  PkeyPtr key = LoadPrivateKey(keyPath);
  openssl::PkeyCtxPtr ctx(EVP_PKEY_CTX_new(key.get(), nullptr));
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

Bytes MintLeafCertificate(const std::string& issuerKey, const std::string& issuerCertificate,
                          const std::string& leafKey, const EVP_MD* md, const Bytes& oidContent,
                          const Bytes& extensionValue) {
  PkeyPtr signer = LoadPrivateKey(issuerKey);
  PkeyPtr subjectKey = LoadPrivateKey(leafKey);
  Bytes issuerDer = ReadFile(issuerCertificate);
  const unsigned char* cursor = issuerDer.data();
  openssl::X509Ptr issuer(
      d2i_X509(nullptr, &cursor, static_cast<long>(issuerDer.size())));
  if (!issuer) throw ToolError("not a DER certificate: " + issuerCertificate);

  Bytes oidDer{0x06, static_cast<uint8_t>(oidContent.size())};
  oidDer.insert(oidDer.end(), oidContent.begin(), oidContent.end());
  cursor = oidDer.data();
  CHandle<ASN1_OBJECT, ASN1_OBJECT_free> oid(
      d2i_ASN1_OBJECT(nullptr, &cursor, static_cast<long>(oidDer.size())));
  CHandle<ASN1_OCTET_STRING, ASN1_OCTET_STRING_free> value(ASN1_OCTET_STRING_new());
  openssl::X509Ptr leaf(X509_new());
  const unsigned char commonName[] = "Brisvale Development Pinned Signer";
  bool built =
      oidContent.size() < 128 && oid && value && leaf &&
      ASN1_OCTET_STRING_set(value.get(), extensionValue.data(),
                            static_cast<int>(extensionValue.size())) == 1 &&
      X509_set_version(leaf.get(), X509_VERSION_3) == 1 &&
      ASN1_INTEGER_set(X509_get_serialNumber(leaf.get()), 0x5151) == 1 &&
      X509_set_issuer_name(leaf.get(), X509_get_subject_name(issuer.get())) == 1 &&
      X509_NAME_add_entry_by_txt(X509_get_subject_name(leaf.get()), "CN", V_ASN1_PRINTABLESTRING,
                                 commonName, -1, -1, 0) == 1 &&
      ASN1_TIME_set_string(X509_getm_notBefore(leaf.get()), "20100101000000Z") == 1 &&
      ASN1_TIME_set_string(X509_getm_notAfter(leaf.get()), "20400101000000Z") == 1 &&
      X509_set_pubkey(leaf.get(), subjectKey.get()) == 1;
  if (built) {
    CHandle<X509_EXTENSION, X509_EXTENSION_free> extension(
        X509_EXTENSION_create_by_OBJ(nullptr, oid.get(), 0, value.get()));
    built = extension && X509_add_ext(leaf.get(), extension.get(), -1) == 1 &&
            X509_sign(leaf.get(), signer.get(), md) > 0;
  }
  unsigned char* der = nullptr;
  int length = built ? i2d_X509(leaf.get(), &der) : -1;
  if (length <= 0) throw ToolError("cannot build the leaf certificate");
  Bytes bytes(der, der + length);
  OPENSSL_free(der);
  return bytes;
}

}  // namespace brisvale::imgtool
