// Fixtures for the verification tests: the signing tool and certificates minted with chosen defects.
#include "test_support.h"

#include <openssl/pem.h>
#include <openssl/rsa.h>
#include <openssl/x509.h>
#include <openssl/x509v3.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <algorithm>
#include <fstream>
#include <iterator>
#include <memory>
#include <stdexcept>

#include "derwriter/der_writer.h"
#include "imgtool/signing.h"
#include "platform/os.h"
#include "platform/services.h"

namespace brisvale::testing {
namespace {

// The verifiers read image and certificate files through the services table.
const ScopedServices systemOs(Services{.os = &os::SystemOs()});

using imgtool::LoadPrivateKey;
using openssl::PkeyPtr;
using openssl::X509Ptr;

X509Ptr LoadDer(const std::string& path) {
  Bytes der = ReadBytes(path);
  const unsigned char* cursor = der.data();
  X509Ptr certificate(d2i_X509(nullptr, &cursor, static_cast<long>(der.size())));
  if (!certificate) throw std::runtime_error("bad certificate " + path);
  return certificate;
}

void Check(bool ok, const char* what) {
  if (!ok) throw std::runtime_error(what);
}

}  // namespace

std::string Pki(const std::string& name) { return std::string(BRISVALE_PKI_DIR) + "/" + name; }


bool RunImgtool(const std::vector<std::string>& args) {
  std::vector<char*> argv{const_cast<char*>(BRISVALE_IMGTOOL)};
  for (const std::string& arg : args) argv.push_back(const_cast<char*>(arg.c_str()));
  argv.push_back(nullptr);
  pid_t child = fork();
  if (child == 0) {
    execv(argv[0], argv.data());
    _exit(127);
  }
  int status = 0;
  if (child < 0 || waitpid(child, &status, 0) != child) return false;
  return WIFEXITED(status) && WEXITSTATUS(status) == 0;
}

Bytes MintCertificate(const CertificateRecipe& recipe) {
  PkeyPtr issuerKey = LoadPrivateKey(recipe.issuerKey);
  PkeyPtr subjectKey = LoadPrivateKey(recipe.subjectKey);
  X509Ptr issuer = LoadDer(recipe.issuerCertificate);
  X509Ptr certificate(X509_new());
  Check(certificate && X509_set_version(certificate.get(), X509_VERSION_3), "version");
  ASN1_INTEGER_set(X509_get_serialNumber(certificate.get()), 4242);
  Check(X509_set_issuer_name(certificate.get(), X509_get_subject_name(issuer.get())), "issuer");
  X509_NAME* subject = X509_get_subject_name(certificate.get());
  Check(X509_NAME_add_entry_by_txt(subject, "CN", V_ASN1_PRINTABLESTRING,
                                   reinterpret_cast<const unsigned char*>(recipe.commonName.c_str()),
                                   -1, -1, 0),
        "subject");
  Check(ASN1_TIME_set_string(X509_getm_notBefore(certificate.get()), recipe.notBefore.c_str()) &&
            ASN1_TIME_set_string(X509_getm_notAfter(certificate.get()), recipe.notAfter.c_str()),
        "validity");
  Check(X509_set_pubkey(certificate.get(), subjectKey.get()), "key");
  if (recipe.paddingExtensionSize > 0) {
    CHandle<ASN1_OBJECT, ASN1_OBJECT_free> oid(
        OBJ_txt2obj("1.3.6.1.4.1.57264.9.9", 1));
    CHandle<ASN1_OCTET_STRING, ASN1_OCTET_STRING_free> value(ASN1_OCTET_STRING_new());
    Bytes filler(recipe.paddingExtensionSize, 0x5A);
    Check(oid && value &&
              ASN1_OCTET_STRING_set(value.get(), filler.data(), static_cast<int>(filler.size())),
          "filler");
    CHandle<X509_EXTENSION, X509_EXTENSION_free> extension(
        X509_EXTENSION_create_by_OBJ(nullptr, oid.get(), 0, value.get()));
    Check(extension && X509_add_ext(certificate.get(), extension.get(), -1), "extension");
  }
  Check(X509_sign(certificate.get(), issuerKey.get(), recipe.digest) > 0, "sign");
  unsigned char* der = nullptr;
  int length = i2d_X509(certificate.get(), &der);
  Check(length > 0, "encode");
  Bytes bytes(der, der + length);
  OPENSSL_free(der);
  return bytes;
}

Bytes ToBeSigned(const Bytes& certificate) {
  // SEQUENCE { tbs SEQUENCE, ... }: skip the outer header, then take one element.
  auto elementSize = [&](size_t offset) {
    size_t lengthByte = certificate.at(offset + 1);
    if (lengthByte < 0x80) return 2 + lengthByte;
    size_t octets = lengthByte & 0x7F, length = 0;
    for (size_t i = 0; i < octets; ++i) length = length * 256 + certificate.at(offset + 2 + i);
    return 2 + octets + length;
  };
  size_t lengthByte = certificate.at(1);
  size_t start = lengthByte < 0x80 ? 2 : 2 + (lengthByte & 0x7F);
  size_t size = elementSize(start);
  return Bytes(certificate.begin() + static_cast<long>(start),
               certificate.begin() + static_cast<long>(start + size));
}

Bytes Resign(const Bytes& toBeSigned, const std::string& issuerKey, const EVP_MD* digest) {
  namespace dw = derwriter;
  Bytes hash(static_cast<size_t>(EVP_MD_get_size(digest)));
  Check(EVP_Digest(toBeSigned.data(), toBeSigned.size(), hash.data(), nullptr, digest, nullptr),
        "digest");
  Bytes signature = imgtool::SignDigest(issuerKey, digest, hash);
  const char* algorithm = EVP_MD_get_type(digest) == NID_sha1     ? "1.2.840.113549.1.1.5"
                          : EVP_MD_get_type(digest) == NID_sha256 ? "1.2.840.113549.1.1.11"
                                                                  : "1.2.840.113549.1.1.12";
  return dw::Sequence({toBeSigned, dw::Sequence({dw::Oid(algorithm), dw::Null()}),
                       dw::BitString(signature)});
}

Bytes FromHex(const std::string& hex) {
  Bytes bytes;
  for (size_t i = 0; i + 1 < hex.size(); i += 2) {
    bytes.push_back(static_cast<uint8_t>(std::stoi(hex.substr(i, 2), nullptr, 16)));
  }
  return bytes;
}

Bytes ReplaceOnce(const Bytes& bytes, const std::string& fromHex, const std::string& toHex) {
  Bytes from = FromHex(fromHex), to = FromHex(toHex);
  auto found = std::search(bytes.begin(), bytes.end(), from.begin(), from.end());
  if (found == bytes.end() || from.size() != to.size() ||
      std::search(found + 1, bytes.end(), from.begin(), from.end()) != bytes.end()) {
    throw std::runtime_error("pattern not found exactly once: " + fromHex);
  }
  Bytes result = bytes;
  std::copy(to.begin(), to.end(), result.begin() + (found - bytes.begin()));
  return result;
}

Bytes RsaPublicKeyOf(const std::string& keyPath) {
  PkeyPtr key = LoadPrivateKey(keyPath);
  unsigned char* der = nullptr;
  int length = i2d_PublicKey(key.get(), &der);
  Check(length > 0, "public key");
  Bytes bytes(der, der + length);
  OPENSSL_free(der);
  return bytes;
}

}  // namespace brisvale::testing
