// Certificate-chain and signature verification for the signed container, with the compiled-in roots.
#include <gtest/gtest.h>
#include <openssl/evp.h>

#include <algorithm>

#include "derwriter/der_writer.h"
#include "imgtool/signing.h"
#include "platform/crypto.h"
#include "test_support.h"
#include "verify/chain/secure_boot.h"
#include "verify/der/der_item_specs.h"

namespace brisvale {
namespace {

using derwriter::Concat;
using testing::Bytes;
using testing::Pki;

Bytes Der(const std::string& name) { return testing::ReadFileBytes(Pki(name)); }
Bytes Hex(const std::string& hex) { return imgtool::ParseHex(hex, "test pattern"); }

struct ChainResult { int status; Bytes publicKey; };

ChainResult Verify(Qor4VerifyChainFunction verify, const Bytes& chain,
                   const Qor4SecureBootParams& params) {
  const uint8_t* key = nullptr;
  const uint8_t* constraints = nullptr;
  uint32_t keyLength = 0, constraintsLength = 0;
  int status = verify(chain.data(), static_cast<uint32_t>(chain.size()), &key, &keyLength,
                      &constraints, &constraintsLength, &params, nullptr);
  return {status, key ? Bytes(key, key + keyLength) : Bytes{}};
}

// The PKI certificate `name` with the first occurrence of `fromHex` in its to-be-signed part
// replaced by `toHex` (as long), signed again by the PKI key `issuer`: only the edit can refuse it.
Bytes Edited(const std::string& name, const std::string& fromHex, const std::string& toHex,
             const std::string& issuer, const EVP_MD* digest) {
  const Bytes certificate = Der(name), from = Hex(fromHex), to = Hex(toHex);
  const DERItem whole{certificate.data(), static_cast<uint32_t>(certificate.size())};
  DERSignedCertCrl parts{};
  EXPECT_EQ(DERResultSuccess, DERParseSequence(&whole, DERNumSignedCertCrlItemSpecs,
                                               DERSignedCertCrlItemSpecs, &parts, sizeof parts));
  Bytes tbs(parts.tbs.data, parts.tbs.data + parts.tbs.length);
  auto found = std::search(tbs.begin(), tbs.end(), from.begin(), from.end());
  EXPECT_TRUE(found != tbs.end() && from.size() == to.size()) << fromHex << " in " << name;
  if (found != tbs.end()) std::copy(to.begin(), to.end(), found);
  const Bytes signature =
      imgtool::SignDigest(Pki(issuer + ".key"), digest, imgtool::DigestOfBytes(tbs, digest));
  const char* algorithm =
      EVP_MD_get_type(digest) == NID_sha1 ? "1.2.840.113549.1.1.5" : "1.2.840.113549.1.1.12";
  return derwriter::Sequence({tbs, derwriter::Sequence({derwriter::Oid(algorithm), derwriter::Null()}),
                              derwriter::BitString(signature)});
}

// A leaf minted the way imgtool mints pinned signers: by `issuer` (key and certificate of
// the PKI) for `subject`'s key, with a private filler extension of `fillerSize` bytes.
Bytes Minted(const std::string& issuer, const std::string& subject, const EVP_MD* digest,
             size_t fillerSize = 1) {
  return imgtool::MintLeafCertificate(Pki(issuer + ".key"), Pki(issuer + ".der"),
                                      Pki(subject + ".key"), digest, Hex("2b0601040183bf300909"),
                                      Bytes(fillerSize, 0x5A));
}

// A secure-boot leaf of exactly `size` bytes, over 64 KiB: there every length of the
// certificate takes three octets, so the size grows with the filler one for one.
Bytes SecureLeafOfSize(size_t size) {
  const size_t overhead = Minted("secure-root", "secure-leaf", EVP_sha384(), 70000).size() - 70000;
  Bytes leaf = Minted("secure-root", "secure-leaf", EVP_sha384(), size - overhead);
  EXPECT_EQ(leaf.size(), size);
  return leaf;
}

TEST(ChainVerify, AcceptsOnlyWellFormedChainsOfTheSet) {
  const Bytes intermediate = Der("general-intermediate.der"), leaf = Der("general-leaf.der");
  const Bytes secureLeaf = Der("secure-leaf.der");
  const std::string rsaOid = "2a864886f70d010101";
  auto secureEdit = [](const std::string& from, const std::string& to) {
    return Edited("secure-leaf.der", from, to, "secure-root", EVP_sha384());
  };
  // The intermediate's name ends in "CA1": both its subject and the leaf's issuer get `end`.
  auto renamed = [](const std::string& end) {
    return Concat({Edited("general-intermediate.der", "434131", end, "general-root", EVP_sha1()),
                   Edited("general-leaf.der", "434131", end, "general-intermediate", EVP_sha1())});
  };
  const Bytes sha256Leaf = Minted("general-intermediate", "general-leaf", EVP_sha256());
  // `sha1`: the SHA-1 set with its intermediate, else the one-certificate SHA-384 set.
  struct Case { const char* name; bool sha1; Bytes chain; int result; } cases[] = {
      {"intermediate and leaf, re-signed", true, renamed("434131"), 0},
      {"intermediate one character off", true, renamed("434132"), -1},
      {"leaf alone", true, leaf, -1},
      {"one leaf too many", true, Concat({intermediate, leaf, leaf}), -1},
      {"SHA-256 leaf under the SHA-1 set", true, Concat({intermediate, sha256Leaf}), -1},
      {"secure leaf", false, secureLeaf, 0},
      {"empty chain", false, {}, -1},
      {"trailing partial element", false, Concat({secureLeaf, Bytes{0x30, 0x05, 0x00}}), -1},
      {"leaf one byte under 128 KiB", false, SecureLeafOfSize(131071), 0},
      {"leaf of 128 KiB", false, SecureLeafOfSize(131072), -1},
      {"key parameters not NULL", false, secureEdit(rsaOid + "0500", rsaOid + "0400"), -1},
      {"unused bits in the key", false, secureEdit("0382020f003082020a", "0382020f013082020a"), -1},
      // Validity dates are not checked: notAfter 2040 becomes 1991 (UTCTime "400101..." to "910101...").
      {"expired", false, secureEdit("170d343030313031", "170d393130313031"), 0},
  };
  for (const Case& c : cases) {
    EXPECT_EQ(c.sha1 ? Verify(verify_chain_qor4_v1, c.chain, kQor4DecodeSecureBootRsa1kSha1).status
                     : Verify(verify_chain_qor4_v2, c.chain, kQor4DecodeSecureBootRsa4kSha384).status,
              c.result)
        << c.name;
  }
}

TEST(ChainVerify, EcdsaChainUnderTheLocalRoot) {
  // The shipped SHA-256 digest info names no digest, so a working set is built here.
  const Qor4DigestInfo sha256{32, &oidSha256, crypto::DigestAlgorithm::Sha256};
  Qor4SecureBootParams working = kQor4DecodeSecureBootEc256Sha256;
  working.digestInfo = &sha256;
  Bytes leaf = Der("ec-leaf.der");
  ChainResult result = Verify(verify_chain_qor4_ecdsa256, leaf, working);
  ASSERT_EQ(result.status, 0);
  EXPECT_EQ(result.publicKey.size(), 65u);
  EXPECT_EQ(Verify(verify_chain_qor4_ecdsa256, leaf, kQor4DecodeSecureBootEc256Sha256).status, -1);
  EXPECT_EQ(Verify(verify_chain_qor4_ecdsa256, Der("secure-leaf.der"), working).status, -1);
}

TEST(SignatureVerify, RsaModulusUpTo4096BitsAndTheSetsDigestLength) {
  const Bytes digest(48, 0x42);
  struct Case { const char* key; const Qor4SecureBootParams* params; int result; } cases[] = {
      {"secure-leaf", &kQor4DecodeSecureBootRsa4kSha384, 0},
      {"rsa-4104", &kQor4DecodeSecureBootRsa4kSha384, -1},
      {"secure-leaf", &kQor4DecodeSecureBootRsa1kSha1, -1},
  };
  for (const Case& c : cases) {
    // The public key as the chain hands it over, from a leaf minted for it.
    const Bytes key = Verify(verify_chain_qor4_v2, Minted("secure-root", c.key, EVP_sha384()),
                             kQor4DecodeSecureBootRsa4kSha384).publicKey;
    ASSERT_FALSE(key.empty()) << c.key;
    const Bytes signature = imgtool::SignDigest(Pki(std::string(c.key) + ".key"), EVP_sha384(), digest);
    EXPECT_EQ(verify_signature_rsa(key.data(), static_cast<uint32_t>(key.size()), signature.data(),
                                   static_cast<uint32_t>(signature.size()), digest.data(), 48,
                                   c.params, nullptr),
              c.result)
        << c.key;
  }
}

TEST(ComputeDigest, RefusesWhatTheSetCannotProduce) {
  // The digests it can produce are checked by every certificate signature above.
  const uint8_t data[] = {1, 2, 3};
  uint8_t out[48];
  EXPECT_EQ(Qor4DecodeComputeDigest(data, 3, out, 48, &kQor4DecodeSecureBootRsa1kSha1), -1);
  EXPECT_EQ(Qor4DecodeComputeDigest(data, 3, out, 32, &kQor4DecodeSecureBootEc256Sha256), -1);
}

// The fixed SHA-1 entry hashes the whole manifest last, once every check has passed.
TEST(EvaluateTrust, FixedSha1EntryAcceptsASha1Manifest) {
  testing::ScratchDir dir;
  testing::WriteFileBytes(dir / "image", Bytes(1000, 7));
  ASSERT_TRUE(testing::RunImgtool({"manifest", "--chain", "sha1", "--image",
                                   (dir / "image").string(), "-o", (dir / "manifest").string()}));
  Bytes manifest = testing::ReadFileBytes(dir / "manifest");
  auto count = [](uint32_t, Qor4PropertyRef, uint32_t, void* seen) {
    ++*static_cast<int*>(seen);
    return 0;
  };
  for (bool tampered : {false, true}) {
    if (tampered) manifest[manifest.size() - 300] ^= 1;  // inside the leaf certificate
    Qor4DecodeContext context{};
    ASSERT_EQ(Qor4DecodeInitManifest(manifest.data(), static_cast<uint32_t>(manifest.size()), &context), 0);
    int visited = 0;
    const int result = Qor4DecodeEvaluateTrust(Qor4Code("pdmg"), &context, count, &visited);
    EXPECT_EQ(result != 0, tampered);
    EXPECT_EQ(visited, tampered ? 0 : 4);  // SDOM, then DGST, EKEY, pdnm
    EXPECT_EQ(context.manifestHashValid != 0, !tampered);
  }
}

}  // namespace
}  // namespace brisvale
