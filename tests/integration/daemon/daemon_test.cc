// The daemon in a sandbox root, driven over its real socket.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "platform/linux/ipc_client.h"
#include "sandbox_daemon.h"

namespace brisvale::testing {
namespace {


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

TEST_F(DaemonTest, HardwareEventsAreLoggedByName) {
  ASSERT_TRUE(daemon.PostHardwareEvent("com.vantrel.example.unknown").ok());
  EXPECT_TRUE(daemon.WaitForLogLine("debug: Unsupported Kestrix Event: com.vantrel.example.unknown"));
  ASSERT_TRUE(daemon.PostHardwareEvent("com.vantrel.brisvale_mounter.detached").ok());
  EXPECT_TRUE(daemon.WaitForLogLine("debug: Kestrix Event: com.vantrel.brisvale_mounter.detached"));
  EXPECT_FALSE(daemon.LogContains(
      "debug: Unsupported Kestrix Event: com.vantrel.brisvale_mounter.detached"));
}

}  // namespace
}  // namespace brisvale::testing
