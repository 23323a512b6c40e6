// A client run as a separate executable, so that the service sees a peer whose
// executable carries entitlements. Exits 0 when the echo names this executable and
// hands back the entitlement the test stored on it.
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <filesystem>

#include "platform/linux/ipc_client.h"

int main(int argc, char** argv) {
  using namespace brisvale;
  if (argc != 2) return 2;
  ipc::ClientReply failure;
  std::optional<ipc::Client> client = ipc::Client::Connect(argv[1], &failure);
  if (!client) {
    std::fprintf(stderr, "%s\n", failure.error.c_str());
    return 3;
  }
  ipc::ClientReply reply = client->Request({{"Tag", "entitled"}}, std::chrono::seconds(5));
  if (!reply.ok()) {
    std::fprintf(stderr, "%s\n", reply.error.c_str());
    return 4;
  }
  const plist::Value* path = reply.body.find("PeerPath");
  const plist::Value* entitlement = reply.body.find("Entitlement");
  const plist::Value expected(plist::Array{"CopyDevices", "SyncDevice"});
  const std::string self = std::filesystem::read_symlink("/proc/self/exe").string();
  if (!path || !path->string() || *path->string() != self) {
    std::fprintf(stderr, "peer path %s, expected %s\n", plist::Describe(path).c_str(), self.c_str());
    return 5;
  }
  if (!entitlement || !(*entitlement == expected)) {
    std::fprintf(stderr, "entitlement %s\n", plist::Describe(entitlement).c_str());
    return 6;
  }
  return 0;
}
