// The daemon's serving path over a fake transport: the request dispatcher (decoding,
// entitlement checks, routing, the binary reply) and the serving state (listener,
// connections, hardware events).
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>

#include "base/log.h"
#include "base/runloop.h"
#include "daemon/daemon.h"
#include "daemon/dispatcher.h"
#include "fake_os.h"
#include "platform/ipc_service.h"
#include "platform/services.h"
#include "registry/registry_model.h"

namespace brisvale {
namespace {

using ::testing::ElementsAre;

// A connection without a socket: records what the daemon sends and cancels.
class FakeConnection : public ipc::Connection {
 public:
  std::string executablePath = "/usr/libexec/imgclient";
  std::optional<plist::Value> allowedSPI;
  std::vector<ipc::Message> sent;
  bool cancelled = false;
  Handler handler;

  void Resume(Handler h) override { handler = std::move(h); }
  bool Send(const ipc::Message& message) override {
    sent.push_back(message);
    return true;
  }
  void Cancel() override { cancelled = true; }
  pid_t PeerPid() const override { return 412; }
  uid_t PeerUid() const override { return 0; }
  std::string PeerExecutablePath() const override { return executablePath; }
  std::optional<plist::Value> CopyEntitlement(std::string_view name) const override {
    if (name == "com.vantrel.private.brisvale.allowedSPI") return allowedSPI;
    return std::nullopt;
  }
};

// Requests reach the real handlers: an empty registry and a mount table with nothing of
// the daemon's in it (an empty one cannot be read).
registry::RegistryModel emptyRegistry;
testing::FakeOs quietOs = [] {
  testing::FakeOs os;
  os.mounts = {{0, "proc", "/proc", "proc"}};
  return os;
}();
const ScopedServices services(Services{&emptyRegistry, &quietOs});

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

plist::Dictionary OfType(plist::Value type) { return {{"RequestType", std::move(type)}}; }

// Each check a request can fail, each request type, and each way an entitlement can
// fall short: what is logged, and the binary reply routed to the caller, or none.
TEST(HandleRequest, RejectsOrServesEachRequestWithItsLines) {
  const std::string missing = "Missing required entitlement (will be required in <kelpie://problem/25909614>): ";
  const struct {
    const char* name;
    ipc::Message message;
    std::vector<std::string> lines;
    const char* status = nullptr;  // none: refused without a reply
    std::optional<plist::Value> allowed = plist::Array{"CopyDevices", "MountDevice", "UnmountDevice", "SyncDevice"};
  } cases[] = {
      // (A message with no encoded dictionary at all is the serving test's.)
      {"dictionary is text", RequestCarrying("RequestType"), {"Invalid or missing value for EncodedDictionary."}},
      {"undecodable bytes", RequestCarrying(plist::Bytes{'b', 'p', 'l', 'i', 's', 't', '0', '0', 1}),
       {"Failed to create dictionary with data."}},
      {"top level is an array", Request(plist::Array{"CopyDevices"}, /*xml=*/true),
       {"Invalid value for RequestType: (null)"}},
      {"operation name is not a request type", Request(OfType("MountDevice")), {"Invalid request type: MountDevice"}},
      // Only a listing succeeds without further keys; the others say which handler ran.
      {"listing", Request(OfType("CopyDevices")), {}, "Success"},
      {"mount", Request(OfType("Mount")), {"Invalid value for DeviceType: (null)"}, "Failure"},
      {"unmount without a reply id", Request(OfType("Unmount"), false, std::nullopt),
       {"Invalid value for MountPath: (null)"}, "Failure"},
      {"sync in XML", Request(OfType("Sync"), /*xml=*/true), {"Failed to extract MountPath from request"}, "Failure"},
      // An absent entitlement fails the same check as one that is no list.
      {"other operation listed", Request(OfType("CopyDevices")),
       {"Invalid or missing entitlement: CopyDevices", missing + "CopyDevices"}, "Success",
       plist::Array{"MountDevice"}},
      {"single string instead of a list", Request(OfType("CopyDevices")),
       {"Invalid or missing entitlement: com.vantrel.private.brisvale.allowedSPI", missing + "CopyDevices"}, "Success",
       plist::Value("CopyDevices")},
      {"non-string elements skipped", Request(OfType("CopyDevices")), {}, "Success",
       plist::Array{plist::Value::Int(1), "CopyDevices"}},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    log::CaptureSink capture;
    FakeConnection connection;
    connection.allowedSPI = c.allowed;
    MatchingContext context;
    EXPECT_EQ(HandleRequest(context, &connection, c.message), c.status != nullptr);
    EXPECT_EQ(capture.Texts(Level::Default), c.lines);
    if (!c.status) {
      EXPECT_TRUE(connection.sent.empty());
      continue;
    }
    ASSERT_EQ(connection.sent.size(), 1u);
    const ipc::Message& reply = connection.sent[0];
    EXPECT_TRUE(reply.isReply);
    EXPECT_EQ(reply.replyToken, c.message.replyToken);
    const plist::Bytes* bytes = reply.body.find("EncodedDictionary")->data();
    ASSERT_NE(bytes, nullptr);
    const std::optional<plist::Value> decoded = plist::ReadBinary(*bytes);  // binary whatever the request was
    ASSERT_TRUE(decoded.has_value());
    EXPECT_EQ(*decoded->get("Status"), plist::Value(c.status));
  }
}

TEST(CopyClientName, NamesTheExecutableAndPidAndRefusesAbsentInputs) {
  FakeConnection connection;
  connection.executablePath = "imgclient";  // no directory
  EXPECT_EQ(CopyClientName(&connection), "imgclient<412>");
  connection.executablePath = "/" + std::string(300, 'a');  // longer than a name may be
  EXPECT_EQ(CopyClientName(&connection), std::string(255, 'a') + "<412>");
  // Absent inputs are refused with a line.
  log::CaptureSink capture;
  EXPECT_EQ(CopyClientName(nullptr), std::nullopt);
  EXPECT_FALSE(CheckAllowedSPI(nullptr, "CopyDevices"));
  EXPECT_FALSE(CheckAllowedSPI(&connection, nullptr));
  EXPECT_THAT(capture.Texts(), ElementsAre("Invalid input.", "Invalid inputs.", "Invalid inputs."));
}

struct FakeListener : ipc::Listener {
  explicit FakeListener(Handler* slot) : slot(slot) {}
  void Resume(Handler handler) override { *slot = std::move(handler); }
  Handler* slot;
};

class FakeIpc : public ipc::IpcService {
 public:
  bool failListener = false;
  ipc::Listener::Handler listenerHandler;
  std::string streamName;
  std::function<void(const ipc::StreamEvent&)> streamHandler;

  std::unique_ptr<ipc::Listener> CreateListener(std::string_view) override {
    if (failListener) return nullptr;
    return std::make_unique<FakeListener>(&listenerHandler);
  }
  std::unique_ptr<ipc::EventStream> RegisterEventStream(
      std::string_view name, std::function<void(const ipc::StreamEvent&)> handler) override {
    streamName = name;
    streamHandler = std::move(handler);
    return std::make_unique<ipc::EventStream>();
  }
  void BeginTransaction() override {}
  void EndTransaction() override {}
  int TransactionCount() const override { return 0; }
};

struct DaemonTest : ::testing::Test {
  RunLoop loop;
  FakeIpc ipc;
  ScopedServices services{Services{&emptyRegistry, &quietOs, &ipc}};
  MatchingContext context;
  std::vector<int> exits;
  Daemon daemon{loop, context, [this](int status) { exits.push_back(status); }};
};

// From a listener that cannot be made, through a connection served, cancelled for a bad
// message and let go of once closed, to a listener that fails for good.
TEST_F(DaemonTest, ListenerAndConnectionsFromStartToEnd) {
  log::CaptureSink capture;
  ipc.failListener = true;
  EXPECT_FALSE(daemon.StartServing());
  EXPECT_THAT(capture.Texts(), ElementsAre("Failed to create vexa listener for com.vantrel.brisvale_mounter.vexa."));
  ipc.failListener = false;
  ASSERT_TRUE(daemon.StartServing());

  auto connection = std::make_shared<FakeConnection>();
  ipc.listenerHandler(connection, ipc::EventKind::Message);
  ASSERT_TRUE(connection->handler);
  ipc::Message bad;  // no EncodedDictionary: rejected, connection cancelled
  connection->handler(ipc::EventKind::Message, &bad);
  EXPECT_TRUE(connection->cancelled);
  capture.Clear();
  connection->handler(ipc::EventKind::ConnectionInvalid, nullptr);
  EXPECT_THAT(capture.Texts(), ElementsAre("connection closed: imgclient<412>"));
  loop.RunOnce();
  EXPECT_EQ(daemon.ConnectionCount(), 0u);

  capture.Clear();
  ipc.listenerHandler(nullptr, ipc::EventKind::ConnectionInvalid);
  EXPECT_THAT(exits, ElementsAre(1));
  EXPECT_THAT(capture.Lines(),
              ElementsAre(log::Line{Level::Error,
                                    "vexa connection listener is invalid. Verify mach service name "
                                    "com.vantrel.brisvale_mounter.vexa is set in vexa plist."}));
}

TEST_F(DaemonTest, HardwareEventsAreRoutedByExactName) {
  ASSERT_TRUE(daemon.StartServing());
  EXPECT_EQ(ipc.streamName, "com.vantrel.kestrix.matching");
  const std::pair<std::string, bool> cases[] = {
      {"com.vantrel.brisvale_mounter.attached", true},
      {"com.vantrel.brisvale_mounter.detached", true},
      {"com.vantrel.mobile.ptp_camera", true},
      {"com.vantrel.brisvale_mounter.ATTACHED", false},
  };
  for (const auto& [name, supported] : cases) {
    log::CaptureSink capture;
    ipc.streamHandler(ipc::StreamEvent{name});
    const std::vector<std::string> lines = capture.Texts();
    EXPECT_EQ(std::ranges::count(lines, "Kestrix Event: " + name), 1) << name;
    EXPECT_EQ(std::ranges::count(lines, "Unsupported Kestrix Event: " + name), supported ? 0 : 1) << name;
  }
  log::CaptureSink capture;
  ipc.streamHandler(ipc::StreamEvent{});
  EXPECT_TRUE(capture.Lines().empty());
}

}  // namespace
}  // namespace brisvale
