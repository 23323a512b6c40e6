// brisvale-imgtool: the signing kit for image builders and tests.
#include <cstdio>
#include <cstring>
#include <string>
#include <vector>

#include "imgtool/commands.h"
#include "imgtool/options.h"

namespace {

constexpr const char* kUsage = R"(usage: brisvale-imgtool COMMAND [OPTIONS]

  sign-developer --key KEY.pem --image IMAGE -o SIGNATURE
      RSA PKCS#1 v1.5 signature over the SHA-1 digest of IMAGE.

  manifest [--image IMAGE] -o MANIFEST [options]
      A personalized manifest for IMAGE, signed with the development PKI.
      --pki DIR              key and certificate directory (default: the development PKI)
      --chain sha1|sha384    signing variant (default sha384): sha1 signs with the
                             intermediate+leaf chain, sha384 with the secure-boot leaf
      --dgst sha1|sha384|hex:BYTES
                             image digest under "pdmg" (default: as --chain)
      --sub-type NAME        "pdnm" of "pdmg" (default DebugDiskImage)
      --nonce HEX  --board N  --chip N  --ecid N
      --production BOOL      CPRO and EPRO
      --security BOOL        CSEC and ESEC
      --sdom N (default 1)   --ekey BOOL (default true)
      --property TAG=TYPE:VALUE          extra manifest property (repeatable)
      --object-property TAG=TYPE:VALUE   extra object property (repeatable)
                             TYPE is int, bool, hex or str
      --object CODE          object code (default pdmg)
      --leaf constrained|plain
                             the leaf with the manifest-constraint extension (default;
                             it pins nothing) or the one without any
      --leaf-constraint TAG=TYPE:VALUE
                             sign with a fresh leaf whose extension pins this manifest
                             property (repeatable)

  identity -o FILE [--nonce HEX] [--board N] [--chip N] [--ecid N]
           [--production BOOL] [--security BOOL] [--hash-method TEXT]
           [--numbers] [--binary]
      A device-identity property list; --numbers writes the modes as 0/1 integers.

  trust-cache DIR -o FILE
      A trust cache holding the SHA-256 of every executable (a regular file with an
      execute bit) below DIR, links not followed.
)";

}  // namespace

int main(int argc, char** argv) {
  using namespace brisvale::imgtool;
  if (argc < 2 || std::strcmp(argv[1], "--help") == 0 || std::strcmp(argv[1], "-h") == 0) {
    std::fputs(kUsage, argc < 2 ? stderr : stdout);
    return argc < 2 ? 2 : 0;
  }
  std::string command = argv[1];
  std::vector<std::string> args(argv + 2, argv + argc);
  try {
    if (command == "sign-developer") return SignDeveloper(args);
    if (command == "manifest") return BuildManifest(args);
    if (command == "identity") return WriteIdentity(args);
    if (command == "trust-cache") return BuildTrustCache(args);
    throw ToolError("unknown command: " + command, true);
  } catch (const ToolError& error) {
    std::fprintf(stderr, "brisvale-imgtool: %s\n", error.what());
    if (error.isUsage) std::fputs("run brisvale-imgtool --help for usage\n", stderr);
    return error.isUsage ? 2 : 1;
  }
}
