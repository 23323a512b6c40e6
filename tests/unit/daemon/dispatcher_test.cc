// The request dispatcher: decoding, entitlement checks, routing and the binary reply.
#include "daemon/dispatcher.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "base/log.h"
#include "fake_connection.h"
#include "fake_os.h"
#include "platform/services.h"
#include "registry/registry_model.h"

namespace brisvale {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using testing::FakeConnection;

// Requests reach the real handlers: an empty registry and a mount table with nothing of
// the daemon's in it.
registry::RegistryModel emptyRegistry;
testing::FakeOs quietOs = [] {
  testing::FakeOs os;
  os.mounts = {{0, "proc", "/proc", "proc"}};
  return os;
}();
const ScopedServices services(Services{&emptyRegistry, &quietOs});

constexpr const char* kMissingEntitlement =
    "Missing required entitlement (will be required in <kelpie://problem/25909614>): ";

ipc::Message RequestCarrying(plist::Value encoded, std::optional<int64_t> id = 7) {
  ipc::Message message;
  message.body.set("EncodedDictionary", std::move(encoded));
  if (id) message.replyToken = plist::Integer{*id, false};
  return message;
}

// A request carrying `dictionary` in the binary format, or in XML, which is read as well.
ipc::Message Request(const plist::Value& dictionary, bool xml = false, std::optional<int64_t> id = 7) {
  const std::string text = xml ? plist::WriteXml(dictionary) : std::string();
  return RequestCarrying(xml ? plist::Value(plist::Bytes(text.begin(), text.end()))
                             : plist::Value(plist::WriteBinary(dictionary)), id);
}

plist::Value AllSPIs() {
  return plist::Array{"CopyDevices", "MountDevice", "UnmountDevice", "SyncDevice"};
}

struct Rejection {
  const char* name;
  ipc::Message message;
  const char* line;
};

TEST(HandleRequest, MalformedRequestsAreRejectedWithTheirLine) {
  const Rejection cases[] = {
      {"no encoded dictionary", ipc::Message{}, "Invalid or missing value for EncodedDictionary."},
      {"encoded dictionary is text", RequestCarrying("RequestType"),
       "Invalid or missing value for EncodedDictionary."},
      {"undecodable bytes", RequestCarrying(plist::Bytes{'b', 'p', 'l', 'i', 's', 't', '0', '0', 1}),
       "Failed to create dictionary with data."},
      {"top level is an array", Request(plist::Array{"CopyDevices"}, /*xml=*/true),
       "Invalid value for RequestType: (null)"},
      {"no request type", Request(plist::Dictionary{{"Other", "x"}}),
       "Invalid value for RequestType: (null)"},
      {"request type not text", Request(plist::Dictionary{{"RequestType", plist::Value::Int(3)}}),
       "Invalid value for RequestType: 3"},
      {"operation name is not a request type",
       Request(plist::Dictionary{{"RequestType", "MountDevice"}}),
       "Invalid request type: MountDevice"},
      {"case matters", Request(plist::Dictionary{{"RequestType", "copydevices"}}),
       "Invalid request type: copydevices"},
  };
  for (const Rejection& c : cases) {
    SCOPED_TRACE(c.name);
    log::CaptureSink capture;
    FakeConnection connection;
    connection.allowedSPI = AllSPIs();
    MatchingContext context;
    EXPECT_FALSE(HandleRequest(context, &connection, c.message));
    EXPECT_THAT(connection.sent, IsEmpty());
    EXPECT_THAT(capture.Texts(Level::Default), ElementsAre(c.line));
  }
}

TEST(HandleRequest, EveryRequestTypeGetsABinaryReplyRoutedToTheCaller) {
  const struct {
    const char* type;
    bool xml;
    std::optional<int64_t> id;  // none: the reply carries none either
  } cases[] = {{"CopyDevices", false, 7}, {"Mount", false, 7}, {"Unmount", false, std::nullopt}, {"Sync", true, 7}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.type);
    log::CaptureSink capture;
    FakeConnection connection;
    connection.allowedSPI = AllSPIs();
    MatchingContext context;
    ASSERT_TRUE(HandleRequest(context, &connection, Request(plist::Dictionary{{"RequestType", c.type}}, c.xml, c.id)));
    ASSERT_EQ(connection.sent.size(), 1u);
    const ipc::Message& reply = connection.sent[0];
    EXPECT_TRUE(reply.isReply);
    EXPECT_EQ(reply.replyToken, c.id ? std::optional(plist::Integer{*c.id, false}) : std::nullopt);
    const plist::Bytes* bytes = reply.body.find("EncodedDictionary")->data();
    ASSERT_NE(bytes, nullptr);
    ASSERT_GE(bytes->size(), 8u);
    EXPECT_EQ(std::string(bytes->begin(), bytes->begin() + 8), "bplist00");
    // Only a listing succeeds without further keys.
    const std::optional<plist::Value> decoded = plist::ReadBinary(*bytes);
    ASSERT_TRUE(decoded.has_value());
    EXPECT_EQ(*decoded->get("Status"), plist::Value(c.type == std::string("CopyDevices") ? "Success" : "Failure"));
  }
}

TEST(HandleRequest, MissingEntitlementIsLoggedAndRequestStillServed) {
  struct Case {
    const char* name;
    std::optional<plist::Value> allowed;
    std::vector<std::string> lines;
  };
  const std::string listed = std::string(kMissingEntitlement) + "CopyDevices";
  const Case cases[] = {
      {"other operation listed", plist::Value(plist::Array{"MountDevice"}),
       {"Invalid or missing entitlement: CopyDevices", listed}},
      {"single string instead of array", plist::Value("CopyDevices"),
       {"Invalid or missing entitlement: com.vantrel.private.brisvale.allowedSPI", listed}},
      {"absent", std::nullopt,
       {"Invalid or missing entitlement: com.vantrel.private.brisvale.allowedSPI", listed}},
      {"non-string elements skipped",
       plist::Value(plist::Array{plist::Value::Int(1), "CopyDevices"}), {}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    log::CaptureSink capture;
    FakeConnection connection;
    connection.allowedSPI = c.allowed;
    MatchingContext context;
    EXPECT_TRUE(HandleRequest(context, &connection,
                              Request(plist::Dictionary{{"RequestType", "CopyDevices"}})));
    EXPECT_EQ(connection.sent.size(), 1u);
    EXPECT_EQ(capture.Texts(Level::Default), c.lines);
  }
}

TEST(CopyClientName, NamesTheExecutableAndPidAndRefusesAbsentInputs) {
  struct Case {
    std::string path;
    std::string name;
  };
  const Case cases[] = {
      {"/usr/libexec/imgclient", "imgclient<412>"},
      {"imgclient", "imgclient<412>"},
      {"", "<412>"},
      {"/usr/bin/", "<412>"},
      {"/" + std::string(300, 'a'), std::string(255, 'a') + "<412>"},
  };
  for (const Case& c : cases) {
    FakeConnection connection;
    connection.executablePath = c.path;
    EXPECT_EQ(CopyClientName(&connection), c.name) << c.path;
  }
  // Absent inputs are refused with a line.
  log::CaptureSink capture;
  FakeConnection connection;
  EXPECT_EQ(CopyClientName(nullptr), std::nullopt);
  EXPECT_FALSE(CheckAllowedSPI(nullptr, "CopyDevices"));
  EXPECT_FALSE(CheckAllowedSPI(&connection, nullptr));
  EXPECT_THAT(capture.Texts(), ElementsAre("Invalid input.", "Invalid inputs.", "Invalid inputs."));
}

}  // namespace
}  // namespace brisvale
