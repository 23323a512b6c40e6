// The daemon's serving state: listener, connections and hardware events over a fake transport.
#include "daemon/daemon.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>

#include "base/log.h"
#include "base/runloop.h"
#include "fake_connection.h"
#include "platform/services.h"

namespace brisvale {
namespace {

using ::testing::Contains;
using ::testing::ElementsAre;
using testing::FakeConnection;

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
  // The other services stay those the test binary installed.
  ScopedServices services{[this] {
    Services withFakeIpc = CurrentServices();
    withFakeIpc.ipc = &ipc;
    return withFakeIpc;
  }()};
  MatchingContext context;
  std::vector<int> exits;
  Daemon daemon{loop, context, [this](int status) { exits.push_back(status); }};
};

TEST_F(DaemonTest, ListenerFailureIsLogged) {
  log::CaptureSink capture;
  ipc.failListener = true;
  EXPECT_FALSE(daemon.StartServing());
  EXPECT_THAT(capture.Texts(),
              ElementsAre("Failed to create vexa listener for com.vantrel.brisvale_mounter.vexa."));
}

TEST_F(DaemonTest, InvalidListenerEndsTheProcess) {
  ASSERT_TRUE(daemon.StartServing());
  log::CaptureSink capture;
  ipc.listenerHandler(nullptr, ipc::EventKind::ConnectionInvalid);
  EXPECT_THAT(exits, ElementsAre(1));
  EXPECT_THAT(capture.Lines(),
              ElementsAre(log::Line{Level::Error,
                                    "vexa connection listener is invalid. Verify mach service name "
                                    "com.vantrel.brisvale_mounter.vexa is set in vexa plist."}));
}

TEST_F(DaemonTest, ConnectionServedThenClosedOnce) {
  ASSERT_TRUE(daemon.StartServing());
  log::CaptureSink capture;
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
}

TEST_F(DaemonTest, HardwareEventsAreRoutedByExactName) {
  ASSERT_TRUE(daemon.StartServing());
  EXPECT_EQ(ipc.streamName, "com.vantrel.kestrix.matching");
  struct Case {
    const char* name;
    bool supported;
  };
  const Case cases[] = {
      {"com.vantrel.brisvale_mounter.attached", true},
      {"com.vantrel.brisvale_mounter.detached", true},
      {"com.vantrel.mobile.ptp_camera", true},
      {"com.vantrel.brisvale_mounter.ATTACHED", false},
      {"com.vantrel.brisvale_mounter.attached ", false},
      {"", false},
  };
  for (const Case& c : cases) {
    log::CaptureSink capture;
    ipc.streamHandler(ipc::StreamEvent{std::string(c.name)});
    const std::vector<std::string> lines = capture.Texts();
    EXPECT_THAT(lines, Contains(std::string("Kestrix Event: ") + c.name));
    EXPECT_EQ(std::ranges::count(lines, std::string("Unsupported Kestrix Event: ") + c.name), c.supported ? 0 : 1)
        << c.name;
  }
  log::CaptureSink capture;
  ipc.streamHandler(ipc::StreamEvent{});
  EXPECT_TRUE(capture.Lines().empty());
}

}  // namespace
}  // namespace brisvale
