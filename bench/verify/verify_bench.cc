// Image digests against `openssl dgst` on the same cached 1 GiB file, and the
// personalized manifest check against the OpenSSL work it cannot avoid (two RSA-4096
// key imports and verifications, and the SHA-384 digests of the same bytes).
//
//   verify_bench --benchmark_filter=Digest     (writes and removes a 1 GiB temp file)
//   verify_bench --benchmark_filter=Manifest
#include <benchmark/benchmark.h>
#include <openssl/bn.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/rsa.h>
#include <openssl/x509.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include "platform/crypto.h"
#include "base/c_handle.h"
#include "platform/device_properties.h"
#include "platform/os.h"
#include "platform/services.h"
#include "test_files.h"
#include "verify/image_digest.h"
#include "verify/personalized_manifest.h"

namespace {

namespace fs = std::filesystem;

// The digests read the image through the services table.
const brisvale::ScopedServices systemOs(brisvale::Services{.os = &brisvale::os::SystemOs()});
using Bytes = std::vector<uint8_t>;

// A temp directory for the run, removed at exit with everything in it.
brisvale::testing::ScratchDir& TempDir() {
  static brisvale::testing::ScratchDir scratch;
  return scratch;
}

int Run(const std::vector<std::string>& args, bool quiet = true) {
  pid_t child = fork();
  if (child == 0) {
    if (quiet) {
      FILE* null = std::freopen("/dev/null", "w", stdout);
      (void)null;
    }
    std::vector<char*> argv;
    for (const std::string& arg : args) argv.push_back(const_cast<char*>(arg.c_str()));
    argv.push_back(nullptr);
    execvp(argv[0], argv.data());
    _exit(127);
  }
  int status = 0;
  waitpid(child, &status, 0);
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

// The 1 GiB image, written once and read once so that it is in the page cache.
const std::string& LargeImage() {
  static const std::string path = [] {
    std::string file = (TempDir() / "image-1g").string();
    std::ofstream out(file, std::ios::binary);
    std::vector<char> block(1 << 20);
    for (size_t i = 0; i < block.size(); ++i) block[i] = static_cast<char>(i * 2654435761u >> 24);
    for (int i = 0; i < 1024; ++i) {
      block[0] = static_cast<char>(i);
      out.write(block.data(), static_cast<std::streamsize>(block.size()));
    }
    out.close();
    Run({"cat", file});
    return file;
  }();
  return path;
}

void BM_DigestImageFile(benchmark::State& state) {
  const std::string& image = LargeImage();
  long length = state.range(0);
  for (auto _ : state) {
    std::vector<uint8_t> digest;
    if (brisvale::verify::DigestImageFile(image, &digest, length) != 0) state.SkipWithError("digest");
    benchmark::DoNotOptimize(digest.data());
  }
  state.SetBytesProcessed(state.iterations() * static_cast<int64_t>(fs::file_size(image)));
}
BENCHMARK(BM_DigestImageFile)->Arg(20)->Arg(48)->Unit(benchmark::kMillisecond)->UseRealTime();

void BM_OpensslDgst(benchmark::State& state) {
  const std::string& image = LargeImage();
  std::string algorithm = state.range(0) == 20 ? "-sha1" : "-sha384";
  for (auto _ : state) {
    if (Run({"openssl", "dgst", algorithm, image}) != 0) state.SkipWithError("openssl dgst");
  }
  state.SetBytesProcessed(state.iterations() * static_cast<int64_t>(fs::file_size(image)));
}
BENCHMARK(BM_OpensslDgst)->Arg(20)->Arg(48)->Unit(benchmark::kMillisecond)->UseRealTime();

// --- Personalized manifest -------------------------------------------------------------

struct ManifestFixture {
  Bytes manifest;
  Bytes imageDigest;
};

const ManifestFixture& Manifest() {
  static const ManifestFixture fixture = [] {
    std::string image = (TempDir() / "image-small").string();
    std::ofstream(image) << "personalized image contents";
    std::string tool = BRISVALE_IMGTOOL;
    std::vector<std::string> device = {"--nonce", "00112233445566778899aabbccddeeff", "--board",
                                       "8", "--chip", "0x8030", "--ecid", "0x1122334455667788",
                                       "--production", "true", "--security", "true"};
    std::vector<std::string> identity = {tool, "identity", "--hash-method", "sha384", "-o",
                                         (TempDir() / "identity.plist").string()};
    identity.insert(identity.end(), device.begin(), device.end());
    std::vector<std::string> manifest = {tool, "manifest", "--image", image, "-o",
                                         (TempDir() / "manifest").string()};
    manifest.insert(manifest.end(), device.begin(), device.end());
    if (Run(identity) != 0 || Run(manifest) != 0) std::abort();
    brisvale::device::SetDeviceIdentityPath((TempDir() / "identity.plist").string());
    ManifestFixture result{brisvale::testing::ReadFileBytes(TempDir() / "manifest"), {}};
    brisvale::verify::DigestImageFile(image, &result.imageDigest, 48);
    return result;
  }();
  return fixture;
}

void BM_VerifyPersonalizedManifest(benchmark::State& state) {
  const ManifestFixture& fixture = Manifest();
  for (auto _ : state) {
    if (brisvale::verify::VerifyPersonalizedManifest(fixture.manifest, fixture.imageDigest) != 0) {
      state.SkipWithError("manifest refused");
    }
  }
}
BENCHMARK(BM_VerifyPersonalizedManifest)->Unit(benchmark::kMicrosecond);

Bytes DerFile(const std::string& name) {
  return brisvale::testing::ReadFileBytes(std::string(BRISVALE_PKI_DIR) + "/" + name);
}

// What any implementation has to do for the same manifest: import the root's and the
// leaf's keys, verify the leaf certificate and the manifest body (RSA-4096 each), and
// take the SHA-384 digests of the manifest, its body and the certificate.
void BM_OpensslBaseline(benchmark::State& state) {
  const ManifestFixture& fixture = Manifest();
  Bytes root = DerFile("secure-root.der");
  Bytes leaf = DerFile("secure-leaf-constrained.der");
  // The leaf's to-be-signed part and signature, and the body and its signature, are
  // located once; locating them is parsing, not the cryptography measured here.
  const unsigned char* cursor = leaf.data();
  brisvale::CHandle<X509, X509_free> leafCertificate(
      d2i_X509(nullptr, &cursor, static_cast<long>(leaf.size())));
  unsigned char* tbsDer = nullptr;
  int tbsLength = i2d_re_X509_tbs(leafCertificate.get(), &tbsDer);
  Bytes tbs(tbsDer, tbsDer + tbsLength);
  OPENSSL_free(tbsDer);
  const ASN1_BIT_STRING* leafSignature = nullptr;
  X509_get0_signature(&leafSignature, nullptr, leafCertificate.get());
  Bytes certificateSignature(ASN1_STRING_get0_data(leafSignature),
                             ASN1_STRING_get0_data(leafSignature) + ASN1_STRING_length(leafSignature));
  // Manifest: SEQUENCE { IA5String, INTEGER, SET body, OCTET STRING signature, ... }.
  auto element = [](const Bytes& bytes, size_t offset, size_t* contentOffset) {
    size_t lengthByte = bytes[offset + 1], length = 0, header = 2;
    if (lengthByte < 0x80) {
      length = lengthByte;
    } else {
      for (size_t i = 0; i < (lengthByte & 0x7F); ++i) length = length * 256 + bytes[offset + 2 + i];
      header += lengthByte & 0x7F;
    }
    *contentOffset = offset + header;
    return header + length;
  };
  const Bytes& manifest = fixture.manifest;
  size_t content = 0;
  element(manifest, 0, &content);
  size_t offset = content, inner = 0;
  offset += element(manifest, offset, &inner);  // magic
  offset += element(manifest, offset, &inner);  // version
  size_t bodyOffset = offset, bodySize = element(manifest, offset, &inner);
  offset += bodySize;
  size_t signatureSize = element(manifest, offset, &inner);
  Bytes body(manifest.begin() + bodyOffset, manifest.begin() + bodyOffset + bodySize);
  Bytes bodySignature(manifest.begin() + inner, manifest.begin() + offset + signatureSize);

  auto verify = [](EVP_PKEY* key, const Bytes& digest, const Bytes& signature) {
    brisvale::CHandle<EVP_PKEY_CTX, EVP_PKEY_CTX_free> ctx(
        EVP_PKEY_CTX_new_from_pkey(nullptr, key, nullptr));
    return EVP_PKEY_verify_init(ctx.get()) == 1 &&
           EVP_PKEY_CTX_set_rsa_padding(ctx.get(), RSA_PKCS1_PADDING) == 1 &&
           EVP_PKEY_CTX_set_signature_md(ctx.get(), EVP_sha384()) == 1 &&
           EVP_PKEY_verify(ctx.get(), signature.data(), signature.size(), digest.data(),
                           digest.size()) == 1;
  };
  auto sha384 = [](const Bytes& bytes) {
    Bytes digest(48);
    EVP_Digest(bytes.data(), bytes.size(), digest.data(), nullptr, EVP_sha384(), nullptr);
    return digest;
  };
  // The keys as SubjectPublicKeyInfo, taken out of the certificates once.
  auto keyInfo = [](const Bytes& certificate) {
    const unsigned char* p = certificate.data();
    brisvale::CHandle<X509, X509_free> x509(
        d2i_X509(nullptr, &p, static_cast<long>(certificate.size())));
    unsigned char* der = nullptr;
    int length = i2d_PUBKEY(X509_get0_pubkey(x509.get()), &der);
    Bytes bytes(der, der + length);
    OPENSSL_free(der);
    return bytes;
  };
  Bytes rootKeyInfo = keyInfo(root), leafKeyInfo = keyInfo(leaf);
  auto importKey = [](const Bytes& info) {
    const unsigned char* p = info.data();
    return brisvale::CHandle<EVP_PKEY, EVP_PKEY_free>(
        d2i_PUBKEY(nullptr, &p, static_cast<long>(info.size())));
  };
  for (auto _ : state) {
    auto rootKey = importKey(rootKeyInfo);
    auto leafKey = importKey(leafKeyInfo);
    Bytes manifestDigest = sha384(manifest);
    bool ok = verify(rootKey.get(), sha384(tbs), certificateSignature) &&
              verify(leafKey.get(), sha384(body), bodySignature);
    benchmark::DoNotOptimize(manifestDigest.data());
    if (!ok) state.SkipWithError("baseline verification failed");
  }
}
BENCHMARK(BM_OpensslBaseline)->Unit(benchmark::kMicrosecond);

// The same work through the platform layer's primitives, whose key import from raw
// modulus and exponent is cheaper than OpenSSL's SubjectPublicKeyInfo decoder: the
// floor for this manifest.
void BM_PrimitiveFloor(benchmark::State& state) {
  const ManifestFixture& fixture = Manifest();
  auto components = [](const std::string& name) {
    Bytes der = DerFile(name);
    const unsigned char* p = der.data();
    brisvale::CHandle<X509, X509_free> x509(d2i_X509(nullptr, &p, static_cast<long>(der.size())));
    BIGNUM* n = nullptr;
    BIGNUM* e = nullptr;
    EVP_PKEY_get_bn_param(X509_get0_pubkey(x509.get()), "n", &n);
    EVP_PKEY_get_bn_param(X509_get0_pubkey(x509.get()), "e", &e);
    std::pair<Bytes, Bytes> result{Bytes(static_cast<size_t>(BN_num_bytes(n))),
                                   Bytes(static_cast<size_t>(BN_num_bytes(e)))};
    BN_bn2bin(n, result.first.data());
    BN_bn2bin(e, result.second.data());
    BN_free(n);
    BN_free(e);
    return result;
  };
  auto [rootN, rootE] = components("secure-root.der");
  auto [leafN, leafE] = components("secure-leaf-constrained.der");
  // Real signatures are not needed for the cost: RSA verification does the same work
  // whether or not the padding then matches.
  Bytes signature(512, 0x17);
  using brisvale::crypto::DigestAlgorithm;
  for (auto _ : state) {
    Bytes digest(48);
    for (int i = 0; i < 3; ++i) {
      brisvale::crypto::Digest(DigestAlgorithm::Sha384, fixture.manifest, digest);
    }
    benchmark::DoNotOptimize(
        brisvale::crypto::VerifyRsaPkcs1(rootN, rootE, DigestAlgorithm::Sha384, digest, signature));
    benchmark::DoNotOptimize(
        brisvale::crypto::VerifyRsaPkcs1(leafN, leafE, DigestAlgorithm::Sha384, digest, signature));
  }
}
BENCHMARK(BM_PrimitiveFloor)->Unit(benchmark::kMicrosecond);

}  // namespace
