// Certificate-chain and signature verification for the signed container, with the compiled-in roots.
#include <gtest/gtest.h>

#include "derwriter/der_writer.h"
#include "imgtool/signing.h"
#include "platform/crypto.h"
#include "test_support.h"
#include "verify/chain/secure_boot.h"

namespace brisvale {
namespace {

using testing::Bytes;
using testing::Pki;

Bytes Concat(const std::vector<Bytes>& parts) { return derwriter::Concat(parts); }

Bytes Der(const std::string& name) { return testing::ReadBytes(Pki(name)); }

struct ChainResult {
  int status;
  Bytes publicKey;
  Bytes constraints;
};

ChainResult Verify(Qor4VerifyChainFunction verify, const Bytes& chain,
                   const Qor4SecureBootParams& params) {
  const uint8_t* key = nullptr;
  uint32_t keyLength = 0;
  const uint8_t* constraints = nullptr;
  uint32_t constraintsLength = 0;
  int status = verify(chain.data(), static_cast<uint32_t>(chain.size()), &key, &keyLength,
                      &constraints, &constraintsLength, &params, nullptr);
  return {status, key ? Bytes(key, key + keyLength) : Bytes{},
          constraints ? Bytes(constraints, constraints + constraintsLength) : Bytes{}};
}

int VerifySha1(const Bytes& chain) {
  return Verify(verify_chain_qor4_v1, chain, kQor4DecodeSecureBootRsa1kSha1).status;
}
int VerifySha384(const Bytes& chain) {
  return Verify(verify_chain_qor4_v2, chain, kQor4DecodeSecureBootRsa4kSha384).status;
}

// A leaf for the SHA-384 chain, signed by the secure-boot root.
testing::CertificateRecipe SecureLeaf() {
  testing::CertificateRecipe recipe;
  recipe.issuerKey = Pki("secure-root.key");
  recipe.issuerCertificate = Pki("secure-root.der");
  recipe.subjectKey = Pki("secure-leaf.key");
  return recipe;
}

// A leaf for the SHA-1 chain, signed by the intermediate.
testing::CertificateRecipe GeneralLeaf() {
  testing::CertificateRecipe recipe;
  recipe.issuerKey = Pki("general-intermediate.key");
  recipe.issuerCertificate = Pki("general-intermediate.der");
  recipe.subjectKey = Pki("general-leaf.key");
  recipe.digest = EVP_sha1();
  return recipe;
}

TEST(ChainVerify, CertificateCountIsExact) {
  Bytes intermediate = Der("general-intermediate.der"), leaf = Der("general-leaf.der");
  Bytes secureLeaf = Der("secure-leaf.der");
  EXPECT_EQ(VerifySha1(Concat({intermediate, leaf})), 0);
  EXPECT_EQ(VerifySha1(leaf), -1);
  EXPECT_EQ(VerifySha1(Concat({intermediate, leaf, leaf})), -1);
  EXPECT_EQ(VerifySha1({}), -1);
  EXPECT_EQ(VerifySha384(secureLeaf), 0);
  EXPECT_EQ(VerifySha384(Concat({secureLeaf, secureLeaf})), -1);
  EXPECT_EQ(VerifySha384({}), -1);
  // Trailing bytes that are not a whole element.
  Bytes truncated = Concat({secureLeaf, Bytes{0x30, 0x05, 0x00}});
  EXPECT_EQ(VerifySha384(truncated), -1);
}

TEST(ChainVerify, OutputsAreTheLeafKeyAndItsConstraints) {
  ChainResult plain = Verify(verify_chain_qor4_v2, Der("secure-leaf.der"),
                             kQor4DecodeSecureBootRsa4kSha384);
  ASSERT_EQ(plain.status, 0);
  EXPECT_EQ(plain.publicKey, testing::RsaPublicKeyOf(Pki("secure-leaf.key")));
  EXPECT_TRUE(plain.constraints.empty());

  ChainResult constrained = Verify(verify_chain_qor4_v1,
                                   Concat({Der("general-intermediate.der"),
                                           Der("general-leaf-constrained.der")}),
                                   kQor4DecodeSecureBootRsa1kSha1);
  ASSERT_EQ(constrained.status, 0);
  EXPECT_EQ(constrained.constraints,
            testing::FromHex("3111ff84ea859c500a300816044d414e503100"));
}

TEST(ChainVerify, RsaCertificatesMustBeSmallerThan128KiB) {
  for (size_t target : {size_t{131071}, size_t{131072}}) {
    testing::CertificateRecipe recipe = SecureLeaf();
    recipe.paddingExtensionSize = target - 1500;
    Bytes leaf = testing::MintCertificate(recipe);
    for (int round = 0; round < 4 && leaf.size() != target; ++round) {
      recipe.paddingExtensionSize += target - leaf.size();
      leaf = testing::MintCertificate(recipe);
    }
    ASSERT_EQ(leaf.size(), target);
    EXPECT_EQ(VerifySha384(leaf), target < kMaxRsaChainCertificateSize ? 0 : -1) << target;
  }
}

TEST(ChainVerify, IntermediateMustCarryTheExpectedName) {
  // An intermediate one character off, properly signed by the general root, with a
  // leaf properly signed by it.
  testing::ScratchDir dir;
  testing::CertificateRecipe intermediate;
  intermediate.issuerKey = Pki("general-root.key");
  intermediate.issuerCertificate = Pki("general-root.der");
  intermediate.subjectKey = Pki("general-intermediate.key");
  intermediate.digest = EVP_sha1();
  intermediate.commonName = "Brisvale Development Manifest Issuing CA2";
  Bytes renamed = testing::MintCertificate(intermediate);
  testing::WriteBytes(dir / "renamed.der", renamed);
  testing::CertificateRecipe leaf = GeneralLeaf();
  leaf.issuerCertificate = (dir / "renamed.der").string();
  EXPECT_EQ(VerifySha1(Concat({renamed, testing::MintCertificate(leaf)})), -1);

  // The same construction with the expected name passes, so only the name differs.
  intermediate.commonName = "Brisvale Development Manifest Issuing CA1";
  Bytes expected = testing::MintCertificate(intermediate);
  testing::WriteBytes(dir / "expected.der", expected);
  leaf.issuerCertificate = (dir / "expected.der").string();
  EXPECT_EQ(VerifySha1(Concat({expected, testing::MintCertificate(leaf)})), 0);
}

TEST(ChainVerify, SignatureAlgorithmMustBeTheSets) {
  testing::CertificateRecipe secure = SecureLeaf();
  testing::CertificateRecipe general = GeneralLeaf();
  secure.digest = general.digest = EVP_sha256();
  EXPECT_EQ(VerifySha384(testing::MintCertificate(secure)), -1);
  EXPECT_EQ(VerifySha1(Concat({Der("general-intermediate.der"), testing::MintCertificate(general)})),
            -1);
}

TEST(ChainVerify, ValidityDatesAreNotChecked) {
  for (auto [notBefore, notAfter] : {std::pair{"19900101000000Z", "19910101000000Z"},
                                     std::pair{"20900101000000Z", "20910101000000Z"}}) {
    testing::CertificateRecipe recipe = SecureLeaf();
    recipe.notBefore = notBefore;
    recipe.notAfter = notAfter;
    EXPECT_EQ(VerifySha384(testing::MintCertificate(recipe)), 0) << notBefore;
  }
}

TEST(ChainVerify, KeyEncodingRules) {
  // Each edit is signed again by the root, so only the edited rule can refuse it.
  Bytes tbs = testing::ToBeSigned(Der("secure-leaf.der"));
  auto resign = [](const Bytes& edited) {
    return testing::Resign(edited, Pki("secure-root.key"), EVP_sha384());
  };
  const std::string rsaOid = "2a864886f70d010101";
  struct Case {
    const char* name;
    Bytes tbs;
    int result;
  } cases[] = {
      {"unchanged", tbs, 0},
      {"parameters not NULL", testing::ReplaceOnce(tbs, rsaOid + "0500", rsaOid + "0400"), -1},
      {"unused bits in key", testing::ReplaceOnce(tbs, "0382020f003082020a", "0382020f013082020a"),
       -1},
  };
  for (const Case& c : cases) EXPECT_EQ(VerifySha384(resign(c.tbs)), c.result) << c.name;
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

TEST(SignatureVerify, RsaModulusUpTo4096Bits) {
  Bytes digest(48, 0x42);
  struct Case {
    const char* key;
    int result;
  } cases[] = {{"secure-leaf.key", 0}, {"rsa-4104.key", -1}};
  for (const Case& c : cases) {
    Bytes key = testing::RsaPublicKeyOf(Pki(c.key));
    Bytes signature = imgtool::SignDigest(Pki(c.key), EVP_sha384(), digest);
    EXPECT_EQ(verify_signature_rsa(key.data(), static_cast<uint32_t>(key.size()), signature.data(),
                                   static_cast<uint32_t>(signature.size()), digest.data(), 48,
                                   &kQor4DecodeSecureBootRsa4kSha384, nullptr),
              c.result)
        << c.key;
  }
  // The digest length must be the set's.
  Bytes key = testing::RsaPublicKeyOf(Pki("secure-leaf.key"));
  Bytes signature = imgtool::SignDigest(Pki("secure-leaf.key"), EVP_sha384(), digest);
  EXPECT_EQ(verify_signature_rsa(key.data(), static_cast<uint32_t>(key.size()), signature.data(),
                                 static_cast<uint32_t>(signature.size()), digest.data(), 48,
                                 &kQor4DecodeSecureBootRsa1kSha1, nullptr),
            -1);
}

TEST(ComputeDigest, RefusesWhatTheSetCannotProduce) {
  Bytes data{1, 2, 3};
  uint8_t out[48];
  EXPECT_EQ(Qor4DecodeComputeDigest(data.data(), 3, out, 20, &kQor4DecodeSecureBootRsa1kSha1), 0);
  Bytes expected(20);
  ASSERT_TRUE(crypto::Digest(crypto::DigestAlgorithm::Sha1, data, expected));
  EXPECT_EQ(Bytes(out, out + 20), expected);
  EXPECT_EQ(Qor4DecodeComputeDigest(data.data(), 3, out, 48, &kQor4DecodeSecureBootRsa1kSha1), -1);
  EXPECT_EQ(Qor4DecodeComputeDigest(data.data(), 0, out, 20, &kQor4DecodeSecureBootRsa1kSha1), -1);
  EXPECT_EQ(Qor4DecodeComputeDigest(data.data(), 3, out, 32, &kQor4DecodeSecureBootEc256Sha256), -1);
  EXPECT_EQ(Qor4DecodeComputeDigest(data.data(), 3, out, 48, nullptr), -1);
}

TEST(EvaluateTrust, FixedSha1EntryAcceptsASha1Manifest) {
  testing::ScratchDir dir;
  testing::WriteBytes(dir / "image", Bytes(1000, 7));
  ASSERT_TRUE(testing::RunImgtool({"manifest", "--chain", "sha1", "--image",
                                   (dir / "image").string(), "-o", (dir / "manifest").string()}));
  Bytes manifest = testing::ReadBytes(dir / "manifest");
  Qor4DecodeContext context{};
  ASSERT_EQ(Qor4DecodeInitManifest(manifest.data(), static_cast<uint32_t>(manifest.size()),
                                   &context),
            0);
  int visited = 0;
  auto count = [](uint32_t, Qor4PropertyRef, uint32_t, void* seen) {
    ++*static_cast<int*>(seen);
    return 0;
  };
  EXPECT_EQ(Qor4DecodeEvaluateTrust(Qor4Code("pdmg"), &context, count, &visited), 0);
  EXPECT_EQ(visited, 4);  // SDOM, then DGST, EKEY, pdnm

  manifest[manifest.size() - 300] ^= 1;  // inside the leaf certificate
  Qor4DecodeContext tampered{};
  ASSERT_EQ(Qor4DecodeInitManifest(manifest.data(), static_cast<uint32_t>(manifest.size()),
                                   &tampered),
            0);
  EXPECT_NE(Qor4DecodeEvaluateTrust(Qor4Code("pdmg"), &tampered, count, &visited), 0);
}

}  // namespace
}  // namespace brisvale
