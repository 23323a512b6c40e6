// The daemon in a sandbox root, driven over its real socket.
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "platform/linux/ipc_client.h"
#include "sandbox_daemon.h"

namespace brisvale::testing {
namespace {

using ::testing::Contains;
using ::testing::Not;

struct DaemonTest : ::testing::Test {
  void SetUp() override {
    BRISVALE_REQUIRE_ROOT();
    ASSERT_TRUE(daemon.Start()) << "daemon did not start in " << daemon.root();
  }
  SandboxDaemon daemon;
};

TEST_F(DaemonTest, BadRequestsCancelTheConnectionWithoutReply) {
  std::string xmlArray = plist::WriteXml(plist::Array{"CopyDevices"});
  const std::pair<const char*, plist::Bytes> cases[] = {
      {"operation name", plist::WriteBinary(plist::Dictionary{{"RequestType", "MountDevice"}})},
      {"lower case", plist::WriteBinary(plist::Dictionary{{"RequestType", "copydevices"}})},
      {"missing type", plist::WriteBinary(plist::Dictionary{{"Other", "x"}})},
      {"array top level", plist::Bytes(xmlArray.begin(), xmlArray.end())},
      {"undecodable", plist::Bytes{'n', 'o', 't', ' ', 'a', ' ', 'p', 'l', 'i', 's', 't'}},
  };
  for (const auto& [name, bytes] : cases) {
    EXPECT_EQ(daemon.SendEncoded(bytes).status, ipc::ClientStatus::Cancelled) << name;
  }
  // Still serving.
  EXPECT_TRUE(daemon.SendRequest(plist::Dictionary{{"RequestType", "Sync"}}).ok());
}

TEST_F(DaemonTest, CallerWithoutEntitlementIsServedAndLogged) {
  ASSERT_TRUE(daemon.SendRequest(plist::Dictionary{{"RequestType", "Unmount"}}).ok());
  EXPECT_TRUE(daemon.WaitForLogLine(
      "default: Invalid or missing entitlement: com.vantrel.private.brisvale.allowedSPI"));
  EXPECT_TRUE(daemon.WaitForLogLine(
      "default: Missing required entitlement (will be required in "
      "<kelpie://problem/25909614>): UnmountDevice"));
}

TEST_F(DaemonTest, CallerWhoseExecutableCarriesTheEntitlementIsServedQuietly) {
  // A copy of the client with the entitlement on it, as the platform's signing would.
  std::string client = daemon.root() + ".ctl";
  std::filesystem::copy_file(BRISVALE_CTL_PATH, client,
                             std::filesystem::copy_options::overwrite_existing);
  std::string entitlements = plist::WriteXml(plist::Dictionary{
      {"com.vantrel.private.brisvale.allowedSPI", plist::Array{"CopyDevices", "SyncDevice"}}});
  if (setxattr(client.c_str(), "trusted.vexa.entitlements", entitlements.data(),
               entitlements.size(), 0) != 0) {
    std::filesystem::remove(client);
    GTEST_SKIP() << "trusted extended attributes unsupported here";
  }
  std::string request = daemon.root() + ".request.plist";
  std::ofstream(request) << plist::WriteXml(plist::Dictionary{{"RequestType", "Sync"}});
  std::string output;
  int status = RunProgram({client, "--root", daemon.root(), "raw", request}, &output);
  std::filesystem::remove(client);
  std::filesystem::remove(request);
  EXPECT_EQ(status, 1) << output;  // served: the daemon answered Failure (no such mount)
  std::string processing = "debug: Processing VEXA request [" +
                           std::filesystem::path(client).filename().string() + "<";
  EXPECT_THAT(daemon.LogLines(), Contains(::testing::StartsWith(processing)));
  EXPECT_THAT(daemon.LogLines(), Not(Contains(::testing::HasSubstr("entitlement"))));
}

TEST_F(DaemonTest, HardwareEventsAreLoggedByName) {
  ASSERT_TRUE(daemon.PostHardwareEvent("com.vantrel.example.unknown").ok());
  EXPECT_TRUE(daemon.WaitForLogLine("debug: Unsupported Kestrix Event: com.vantrel.example.unknown"));
  ASSERT_TRUE(daemon.PostHardwareEvent("com.vantrel.brisvale_mounter.detached").ok());
  EXPECT_TRUE(daemon.WaitForLogLine("debug: Kestrix Event: com.vantrel.brisvale_mounter.detached"));
  EXPECT_FALSE(daemon.LogContains(
      "debug: Unsupported Kestrix Event: com.vantrel.brisvale_mounter.detached"));
}

TEST(DaemonActivation, SocketPassedByTheLauncherIsServed) {
  BRISVALE_REQUIRE_ROOT();
  SandboxDaemon daemon;
  std::string path = daemon.root() + ".activation.sock";
  int listener = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  ASSERT_GE(listener, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::snprintf(address.sun_path, sizeof address.sun_path, "%s", path.c_str());
  ASSERT_EQ(bind(listener, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
  ASSERT_EQ(listen(listener, 16), 0);
  ASSERT_TRUE(daemon.Start({}, listener));
  close(listener);
  std::optional<ipc::Client> client = ipc::Client::Connect(path);
  ASSERT_TRUE(client.has_value());
  ipc::ClientReply reply = client->Request(
      plist::Dictionary{{"EncodedDictionary",
                         plist::Value(plist::WriteBinary(plist::Dictionary{{"RequestType", "Sync"}}))}},
      std::chrono::seconds(10));
  EXPECT_TRUE(reply.ok()) << reply.error;
  unlink(path.c_str());
}

}  // namespace
}  // namespace brisvale::testing
