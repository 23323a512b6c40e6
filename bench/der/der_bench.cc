// Decoding cost of the DER layer beside OpenSSL's parser: a realistic manifest (a dozen
// properties, one object, a two-certificate chain) decoded and walked, and one X.509
// certificate parsed with the item-spec tables, each next to d2i_X509 on the same bytes.
#include <benchmark/benchmark.h>
#include <openssl/x509.h>

#include <fstream>
#include <iterator>

#include "derwriter/der_writer.h"
#include "verify/container/qor4.h"
#include "verify/der/der_item_specs.h"

namespace brisvale {
namespace {

using derwriter::Bytes;

const Bytes& Certificate() {
  static const Bytes bytes = [] {
    std::ifstream in(BRISVALE_BENCH_CERTIFICATE, std::ios::binary);
    return Bytes(std::istreambuf_iterator<char>(in), {});
  }();
  return bytes;
}

const Bytes& RealisticManifest() {
  using namespace derwriter;
  static const Bytes manifest = [] {
    const std::vector<Bytes> properties = {
        DataProperty("BNCH", Bytes(32, 0x11)),   IntegerProperty("BORD", 0x10),
        IntegerProperty("CHIP", 0x8020),         BooleanProperty("CPRO", true),
        BooleanProperty("CSEC", true),           IntegerProperty("ECID", 0x1122334455667788ull),
        BooleanProperty("EPRO", true),           BooleanProperty("ESEC", true),
        IntegerProperty("SDOM", 1),              DataProperty("snon", Bytes(20, 0x22)),
        StringProperty("srvn", "2024.1"),        IntegerProperty("love", 7)};
    const std::vector<Bytes> object = {DataProperty("DGST", Bytes(48, 0xD5)),
                                       StringProperty("pdnm", "DebugDiskImage"),
                                       BooleanProperty("EKEY", true)};
    return Manifest(ManifestBody(properties, {{"pdmg", object}}), Bytes(512, 0x5E),
                    {Certificate(), Certificate()});
  }();
  return manifest;
}

int Trivial(const uint8_t*, uint32_t, uint8_t* out, uint32_t length, const Qor4SecureBootParams*) {
  for (uint32_t i = 0; i < length; i++) out[i] = static_cast<uint8_t>(i);
  return 0;
}
int Chain(const uint8_t* chain, uint32_t length, const uint8_t** key, uint32_t* keyLength,
          const uint8_t**, uint32_t*, const Qor4SecureBootParams*, void*) {
  *key = chain;
  *keyLength = length;
  return 0;
}
int Signature(const uint8_t*, uint32_t, const uint8_t*, uint32_t, const uint8_t*, uint32_t,
              const Qor4SecureBootParams*, void*) {
  return 0;
}
int NoConstraints(Qor4DecodeContext*, void*) { return 0; }
int ReadValue(uint32_t tag, Qor4PropertyRef property, uint32_t, void* sink) {
  const uint8_t* data;
  uint32_t length = 0;
  uint64_t number = 0;
  Qor4DecodeGetPropertyData(&property.encoding, tag, 0, &data, &length);
  Qor4DecodeGetPropertyInteger64(&property.encoding, tag, 0, &number);
  *static_cast<uint64_t*>(sink) += length + number;
  return 0;
}

constexpr Qor4DigestInfo kInfo = {48, nullptr, std::nullopt};
constexpr Qor4SecureBootParams kParams = {Trivial, Chain, Signature, NoConstraints, &kInfo,
                                          nullptr, nullptr};

// Decode, split the chain into its certificates, run the evaluation and read every value.
void BM_ManifestDecodeAndWalk(benchmark::State& state) {
  const Bytes& manifest = RealisticManifest();
  uint64_t sink = 0;
  for (auto _ : state) {
    Qor4DecodeContext context{};
    Qor4DecodeInitManifest(manifest.data(), static_cast<uint32_t>(manifest.size()), &context);
    DERSequence chain;
    DERDecodeSeqContentInit(&context.manifest.certificateChain, &chain);
    DERDecodedItem certificate;
    while (DERDecodeSeqNext(&chain, &certificate) == DERResultSuccess) sink++;
    const Qor4PropertyCallbacks callbacks = {ReadValue, nullptr};
    const int result = Qor4DecodePerformTrustEvaluatationWithCallbacks(
        Qor4Code("pdmg"), &context, &callbacks, &kParams, &sink);
    if (result != 0) state.SkipWithError("evaluation failed");
  }
  benchmark::DoNotOptimize(sink);
}
BENCHMARK(BM_ManifestDecodeAndWalk);

// What OpenSSL needs just to parse the manifest's two chain certificates.
void BM_OpenSslChainD2i(benchmark::State& state) {
  const Bytes& der = Certificate();
  for (auto _ : state) {
    for (int i = 0; i < 2; i++) {
      const unsigned char* cursor = der.data();
      X509* x509 = d2i_X509(nullptr, &cursor, static_cast<long>(der.size()));
      if (x509 == nullptr) state.SkipWithError("d2i_X509 failed");
      X509_free(x509);
    }
  }
}
BENCHMARK(BM_OpenSslChainD2i);

// The fields a chain verifier reads: signed part, TBS, key info, RSA key, extensions.
void BM_ItemSpecCertificate(benchmark::State& state) {
  const Bytes& der = Certificate();
  const DERItem input = {der.data(), static_cast<uint32_t>(der.size())};
  uint64_t sink = 0;
  for (auto _ : state) {
    DERSignedCertCrl signedCert;
    DERTBSCert tbs;
    DERSubjPubKeyInfo keyInfo;
    DERAlgorithmId algorithm;
    DERRSAPubKeyPKCS1 rsa;
    DERItem keyBits;
    uint8_t unused;
    DERTag tag;
    DERSequence extensions;
    DERDecodedItem element;
    bool ok = DERParseSequence(&input, DERNumSignedCertCrlItemSpecs, DERSignedCertCrlItemSpecs,
                               &signedCert, sizeof signedCert) == 0 &&
              DERParseSequence(&signedCert.tbs, DERNumTBSCertItemSpecs, DERTBSCertItemSpecs, &tbs,
                               sizeof tbs) == 0 &&
              DERParseSequenceContent(&tbs.subjectPubKey, DERNumSubjPubKeyInfoItemSpecs,
                                      DERSubjPubKeyInfoItemSpecs, &keyInfo, sizeof keyInfo) == 0 &&
              DERParseSequenceContent(&keyInfo.algId, DERNumAlgorithmIdItemSpecs,
                                      DERAlgorithmIdItemSpecs, &algorithm, sizeof algorithm) == 0 &&
              DERParseBitString(&keyInfo.pubKey, &keyBits, &unused) == 0 &&
              DERParseSequence(&keyBits, DERNumRSAPubKeyPKCS1ItemSpecs, DERRSAPubKeyPKCS1ItemSpecs,
                               &rsa, sizeof rsa) == 0 &&
              DERDecodeSeqInit(&tbs.extensions, &tag, &extensions) == 0;
    while (ok && DERDecodeSeqNext(&extensions, &element) == DERResultSuccess) {
      DERExtension extension;
      ok = DERParseSequenceContent(&element.content, DERNumExtensionItemSpecs,
                                   DERExtensionItemSpecs, &extension, sizeof extension) == 0;
      sink += extension.extnValue.length;
    }
    if (!ok) state.SkipWithError("item-spec parse failed");
    sink += rsa.modulus.length;
  }
  benchmark::DoNotOptimize(sink);
}
BENCHMARK(BM_ItemSpecCertificate);

void BM_OpenSslCertificateD2i(benchmark::State& state) {
  const Bytes& der = Certificate();
  for (auto _ : state) {
    const unsigned char* cursor = der.data();
    X509* x509 = d2i_X509(nullptr, &cursor, static_cast<long>(der.size()));
    if (x509 == nullptr) state.SkipWithError("d2i_X509 failed");
    X509_free(x509);
  }
}
BENCHMARK(BM_OpenSslCertificateD2i);

}  // namespace
}  // namespace brisvale
