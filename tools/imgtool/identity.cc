// Device-identity files matching a manifest's device, and developer image signatures.
#include <string>

#include "base/plist.h"
#include "imgtool/commands.h"
#include "imgtool/options.h"
#include "imgtool/signing.h"

namespace brisvale::imgtool {

int WriteIdentity(const std::vector<std::string>& args) {
  Options options(args,
                  {"--nonce", "--board", "--chip", "--ecid", "--production", "--security",
                   "--hash-method", "--output"},
                  {}, {"--numbers", "--binary"});
  std::string output = options.Require("--output");
  // Production and security modes are booleans, or integers 0/1 with --numbers.
  auto flag = [&](bool value) {
    return options.Has("--numbers") ? plist::Value::Int(value ? 1 : 0) : plist::Value::Bool(value);
  };
  plist::Dictionary identity;
  if (auto nonce = options.Get("--nonce")) identity.set("ApNonce", plist::Value(ParseHex(*nonce, "--nonce")));
  if (auto board = options.Get("--board")) {
    identity.set("BoardId", plist::Value::UInt(ParseNumber(*board, "--board")));
  }
  if (auto chip = options.Get("--chip")) {
    identity.set("ChipID", plist::Value::UInt(ParseNumber(*chip, "--chip")));
  }
  if (auto ecid = options.Get("--ecid")) {
    identity.set("UniqueChipID", plist::Value::UInt(ParseNumber(*ecid, "--ecid")));
  }
  if (auto production = options.Get("--production")) {
    bool value = ParseBool(*production, "--production");
    identity.set("CertificateProductionStatus", flag(value));
    identity.set("EffectiveProductionStatusAp", flag(value));
  }
  if (auto security = options.Get("--security")) {
    bool value = ParseBool(*security, "--security");
    identity.set("CertificateSecurityMode", flag(value));
    identity.set("EffectiveSecurityModeAp", flag(value));
  }
  if (auto method = options.Get("--hash-method")) identity.set("Qor4CryptoHashMethod", *method);
  plist::Value root(std::move(identity));
  if (options.Has("--binary")) {
    WriteFile(output, plist::WriteBinary(root));
  } else {
    std::string xml = plist::WriteXml(root);
    WriteFile(output, Bytes(xml.begin(), xml.end()));
  }
  return 0;
}

int SignDeveloper(const std::vector<std::string>& args) {
  Options options(args, {"--key", "--image", "--output"});
  Bytes digest = DigestOfFile(options.Require("--image"), EVP_sha1());
  WriteFile(options.Require("--output"), SignDigest(options.Require("--key"), EVP_sha1(), digest));
  return 0;
}

}  // namespace brisvale::imgtool
