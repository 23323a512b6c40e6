// Owning handles for the OpenSSL objects the Linux platform layers, the signing tool
// and the tests use, so that every path releases what it made without a manual free.
#pragma once

#include <openssl/bio.h>
#include <openssl/evp.h>
#include <openssl/x509.h>
#include <openssl/x509_vfy.h>

#include "base/c_handle.h"
#include "platform/crypto.h"

namespace brisvale::openssl {

using PkeyPtr = CHandle<EVP_PKEY, EVP_PKEY_free>;
using PkeyCtxPtr = CHandle<EVP_PKEY_CTX, EVP_PKEY_CTX_free>;
using MdCtxPtr = CHandle<EVP_MD_CTX, EVP_MD_CTX_free>;
using BioPtr = CHandle<BIO, BIO_free>;
using X509Ptr = CHandle<X509, X509_free>;
using X509StorePtr = CHandle<X509_STORE, X509_STORE_free>;
using X509StoreCtxPtr = CHandle<X509_STORE_CTX, X509_STORE_CTX_free>;

// A stack that owns its certificates.
inline void FreeX509Stack(STACK_OF(X509) * stack) { sk_X509_pop_free(stack, X509_free); }
using X509StackPtr = CHandle<STACK_OF(X509), FreeX509Stack>;

// OpenSSL's digest for one of the platform's algorithms.
inline const EVP_MD* MessageDigest(crypto::DigestAlgorithm algorithm) {
  switch (algorithm) {
    case crypto::DigestAlgorithm::Sha1: return EVP_sha1();
    case crypto::DigestAlgorithm::Sha256: return EVP_sha256();
    case crypto::DigestAlgorithm::Sha384: return EVP_sha384();
  }
  return nullptr;
}

}  // namespace brisvale::openssl
