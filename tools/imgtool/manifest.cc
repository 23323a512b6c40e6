// Personalized manifests: the identity properties of one device and the digest of one
// image, signed with a development leaf key and carrying its certificate chain.
#include <string>

#include "derwriter/der_writer.h"
#include "imgtool/commands.h"
#include "imgtool/options.h"
#include "imgtool/signing.h"

namespace brisvale::imgtool {
namespace {

namespace dw = derwriter;

std::string FourCharCode(const std::string& text, const std::string& what) {
  if (text.size() != 4) throw ToolError(what + ": a tag has exactly four characters: " + text);
  return text;
}

// TAG=int:N, TAG=bool:B, TAG=hex:BYTES or TAG=str:TEXT.
Bytes TypedProperty(const std::string& property, const std::string& what) {
  size_t equals = property.find('=');
  size_t colon = property.find(':', equals == std::string::npos ? 0 : equals);
  if (equals == std::string::npos || colon == std::string::npos) {
    throw ToolError(what + ": expected TAG=int:N|bool:B|hex:BYTES|str:TEXT, got " + property, true);
  }
  std::string tag = FourCharCode(property.substr(0, equals), what);
  std::string type = property.substr(equals + 1, colon - equals - 1);
  std::string value = property.substr(colon + 1);
  if (type == "int") return dw::IntegerProperty(tag, ParseNumber(value, what));
  if (type == "bool") return dw::BooleanProperty(tag, ParseBool(value, what));
  if (type == "hex") return dw::DataProperty(tag, ParseHex(value, what));
  if (type == "str") return dw::StringProperty(tag, value);
  throw ToolError(what + ": unknown value type " + type, true);
}

}  // namespace

int BuildManifest(const std::vector<std::string>& args) {
  Options options(args,
                  {"--pki", "--image", "--sub-type", "--chain", "--dgst", "--nonce", "--board",
                   "--chip", "--ecid", "--production", "--security", "--sdom", "--ekey",
                   "--object", "--leaf", "--output"},
                  {"--property", "--object-property", "--leaf-constraint"});
  std::string pki = options.Get("--pki").value_or(BRISVALE_DEV_PKI_DIR);
  std::string output = options.Require("--output");

  std::string chain = options.Get("--chain").value_or("sha384");
  if (chain != "sha1" && chain != "sha384") throw ToolError("--chain is sha1 or sha384", true);
  const EVP_MD* bodyDigest = DigestNamed(chain);

  Bytes imageDigest;
  std::string dgst = options.Get("--dgst").value_or(chain);
  if (dgst.rfind("hex:", 0) == 0) {
    imageDigest = ParseHex(dgst.substr(4), "--dgst");
  } else if (dgst == "sha1" || dgst == "sha384") {
    imageDigest = DigestOfFile(options.Require("--image"), DigestNamed(dgst));
  } else {
    throw ToolError("--dgst is sha1, sha384 or hex:BYTES", true);
  }

  std::vector<dw::Bytes> manifestProperties;
  if (auto nonce = options.Get("--nonce")) {
    manifestProperties.push_back(dw::DataProperty("BNCH", ParseHex(*nonce, "--nonce")));
  }
  if (auto board = options.Get("--board")) {
    manifestProperties.push_back(dw::IntegerProperty("BORD", ParseNumber(*board, "--board")));
  }
  if (auto chip = options.Get("--chip")) {
    manifestProperties.push_back(dw::IntegerProperty("CHIP", ParseNumber(*chip, "--chip")));
  }
  if (auto production = options.Get("--production")) {
    bool value = ParseBool(*production, "--production");
    manifestProperties.push_back(dw::BooleanProperty("CPRO", value));
    manifestProperties.push_back(dw::BooleanProperty("EPRO", value));
  }
  if (auto security = options.Get("--security")) {
    bool value = ParseBool(*security, "--security");
    manifestProperties.push_back(dw::BooleanProperty("CSEC", value));
    manifestProperties.push_back(dw::BooleanProperty("ESEC", value));
  }
  if (auto ecid = options.Get("--ecid")) {
    manifestProperties.push_back(dw::IntegerProperty("ECID", ParseNumber(*ecid, "--ecid")));
  }
  manifestProperties.push_back(
      dw::IntegerProperty("SDOM", ParseNumber(options.Get("--sdom").value_or("1"), "--sdom")));
  for (const std::string& property : options.All("--property")) {
    manifestProperties.push_back(TypedProperty(property, "--property"));
  }

  std::string subType = options.Get("--sub-type").value_or("DebugDiskImage");
  dw::ManifestObject object{FourCharCode(options.Get("--object").value_or("pdmg"), "--object"),
                            {}};
  object.properties.push_back(dw::DataProperty("DGST", imageDigest));
  object.properties.push_back(
      dw::BooleanProperty("EKEY", ParseBool(options.Get("--ekey").value_or("true"), "--ekey")));
  object.properties.push_back(
      dw::DataProperty("pdnm", Bytes(subType.begin(), subType.end())));
  for (const std::string& property : options.All("--object-property")) {
    object.properties.push_back(TypedProperty(property, "--object-property"));
  }

  // The SHA-1 chain is intermediate then leaf under the general root; the SHA-384 chain
  // is one leaf under the secure-boot root. The leaf carries the constraint extension
  // (empty unless constraints are asked for), or none with --leaf plain.
  std::string issuer = chain == "sha1" ? pki + "/general-intermediate" : pki + "/secure-root";
  std::string leaf = chain == "sha1" ? pki + "/general-leaf" : pki + "/secure-leaf";
  std::string leafKind = options.Get("--leaf").value_or("constrained");
  if (leafKind != "constrained" && leafKind != "plain") {
    throw ToolError("--leaf is constrained or plain", true);
  }
  std::vector<dw::Bytes> certificates;
  if (chain == "sha1") certificates.push_back(ReadFile(pki + "/general-intermediate.der"));
  std::vector<std::string> constraints = options.All("--leaf-constraint");
  if (!constraints.empty()) {
    if (leafKind == "plain") throw ToolError("--leaf-constraint needs the constrained leaf", true);
    std::vector<dw::Bytes> pinned;
    for (const std::string& property : constraints) {
      pinned.push_back(TypedProperty(property, "--leaf-constraint"));
    }
    certificates.push_back(MintLeafCertificate(
        issuer + ".key", issuer + ".der", leaf + ".key", bodyDigest,
        ReadFile(pki + "/manifest-constraint-oid.bin"), dw::Set({dw::Dictionary("MANP", pinned)})));
  } else {
    certificates.push_back(ReadFile(leaf + (leafKind == "plain" ? ".der" : "-constrained.der")));
  }

  dw::Bytes body = dw::ManifestBody(manifestProperties, {object});
  Bytes signature = SignDigest(leaf + ".key", bodyDigest,
                               DigestOfBytes(body, bodyDigest));
  WriteFile(output, dw::Manifest(body, signature, certificates));
  return 0;
}

}  // namespace brisvale::imgtool
