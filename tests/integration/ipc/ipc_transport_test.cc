// The Linux transport over real sockets in a temporary directory: an echo service
// built on it, well-behaved and misbehaving clients side by side.
#include <fcntl.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <atomic>
#include <filesystem>
#include <mutex>
#include <thread>

#include "base/log.h"
#include "base/runloop.h"
#include "platform/linux/ipc_client.h"
#include "platform/linux/ipc_frame.h"
#include "platform/linux/ipc_linux.h"
#include "platform/linux/ipc_socket.h"
#include "test_files.h"

namespace brisvale::ipc {
namespace {

using namespace std::chrono_literals;
using Bytes = std::vector<uint8_t>;

constexpr char kEntitlementKey[] = "com.vantrel.private.brisvale.allowedSPI";

std::string Text(const plist::Dictionary& body, std::string_view key) {
  const plist::Value* value = body.find(key);
  return value && value->string() ? *value->string() : std::string();
}

// A client that speaks raw bytes, for the misbehaving cases.
struct RawPeer {
  UniqueFd fd;
  FrameReader reader;

  explicit RawPeer(UniqueFd socket) : fd(std::move(socket)) {}
  void Write(const Bytes& bytes) const {
    ASSERT_EQ(send(fd.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL), ssize_t(bytes.size()));
  }
  // The next frames, or none when the service closed the connection first.
  std::optional<std::vector<plist::Dictionary>> Read(size_t count, std::chrono::milliseconds timeout = 3s) {
    std::vector<plist::Dictionary> frames;
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    while (frames.size() < count && std::chrono::steady_clock::now() < deadline) {
      uint8_t buffer[4096];
      const ssize_t n = recv(fd.get(), buffer, sizeof buffer, MSG_DONTWAIT);
      if (n == 0 || (n < 0 && errno == ECONNRESET)) return std::nullopt;
      if (n > 0) reader.Feed(std::span<const uint8_t>(buffer, size_t(n)), frames);
      else std::this_thread::sleep_for(1ms);
    }
    return frames;
  }
  // True when the service closes the connection within `timeout`.
  bool ClosedWithin(std::chrono::milliseconds timeout) { return !Read(SIZE_MAX, timeout); }
};

Bytes FrameOf(const plist::Dictionary& body) { return *EncodeFrame(body); }

plist::Value EntitledSPIs() { return plist::Array{"CopyDevices", "SyncDevice"}; }

// This test program, copied and given entitlements, as a client of the echo service:
// 0 when the echo names the copy and hands back the entitlement stored on it, but hands
// back none on `inherited`, the connection this process made before it became the copy.
int RunAsEntitledPeer(const char* socketPath, const char* inherited) {
  std::optional<Client> client = Client::Connect(socketPath);
  const ClientReply reply = client ? client->Request({{"Tag", "entitled"}}, 5s) : ClientReply{};
  const plist::Value* entitlement = reply.body.find("Entitlement");
  const std::string self = std::filesystem::read_symlink("/proc/self/exe").string();
  RawPeer beforeExec(UniqueFd(std::atoi(inherited)));
  const Bytes request = FrameOf({{"Tag", "after the exec"}});
  const bool sent = send(beforeExec.fd.get(), request.data(), request.size(), MSG_NOSIGNAL) == ssize_t(request.size());
  const auto unentitled = beforeExec.Read(1);
  return reply.ok() && Text(reply.body, "PeerPath") == self && entitlement && *entitlement == EntitledSPIs() &&
                 sent && unentitled && unentitled->size() == 1 && !(*unentitled)[0].find("Entitlement")
             ? 0
             : 1;
}

class TransportTest : public ::testing::Test {
 protected:
  void SetUp() override {
    chmod(scratch_.str().c_str(), 0755);  // a poster running as another user must reach the sockets
    options_.socketDirectory = scratch_.str() + "/run/vexa";
    options_.partialFrameTimeout = 300ms;
    options_.outgoingQueueLimit = 256 * 1024;
    options_.kernelDeviceEvents = false;
  }

  void TearDown() override {
    if (loop_) loop_->Stop();
    if (thread_.joinable()) thread_.join();
  }

  std::string SocketPath() const { return ServiceSocketPath(options_, "echo"); }

  // Starts the echo service and runs the loop on its own thread; `beforeRun` may
  // register event streams while the loop is still idle.
  void Start(const std::function<void()>& beforeRun = {}) {
    // The loop is made here, not with the fixture, so that a test can place a socket
    // on descriptor 3 first, as a launcher would.
    loop_ = std::make_unique<RunLoop>();
    service_ = CreateLinuxIpcService(*loop_, options_);
    listener_ = service_->CreateListener("echo");
    ASSERT_TRUE(listener_);
    listener_->Resume([this](std::shared_ptr<Connection> connection, EventKind) {
      std::weak_ptr<Connection> weak = connection;
      connection->Resume([this, weak](EventKind kind, const Message* message) {
        auto connection = weak.lock();
        if (kind == EventKind::ConnectionInvalid) ++invalidEvents_;
        if (kind == EventKind::Message && connection) Echo(*connection, *message);
      });
    });
    if (beforeRun) beforeRun();
    thread_ = std::thread([this] { loop_->Run(); });
  }

  void Echo(Connection& connection, const Message& message) {
    const std::string command = Text(message.body, "Command");
    if (command == "Drop") return connection.Cancel();
    if (command == "Ignore") return;
    if (command == "Slow") std::this_thread::sleep_for(150ms);
    Message reply = *CreateReply(message);
    reply.body = message.body;
    reply.body.set("PeerPid", plist::Value::Int(connection.PeerPid()));
    reply.body.set("PeerPath", connection.PeerExecutablePath());
    if (auto entitlement = connection.CopyEntitlement(kEntitlementKey)) reply.body.set("Entitlement", *entitlement);
    if (command == "Big") reply.body.set("Blob", plist::Value(Bytes(64 * 1024, 0x5A)));
    connection.Send(reply);
  }

  const brisvale::testing::ScratchDir scratch_;  // outlives the service and its sockets
  IpcOptions options_;
  std::optional<Client> lingering_;  // still connected when the service goes
  std::unique_ptr<RunLoop> loop_;
  std::unique_ptr<IpcService> service_;
  std::unique_ptr<Listener> listener_;
  std::vector<std::unique_ptr<EventStream>> streams_;
  std::thread thread_;
  std::atomic<int> invalidEvents_{0};
};

TEST_F(TransportTest, EchoesWithThePeerIdentityAndTellsFailuresApart) {
  ClientReply before;
  EXPECT_FALSE(Client::Connect(SocketPath(), &before));
  EXPECT_EQ(before.status, ClientStatus::NotRunning) << before.error;

  Start();
  std::optional<Client> client = Client::Connect(SocketPath());
  ASSERT_TRUE(client);
  ClientReply reply = client->Request({{"Tag", "a"}}, 3s);
  ASSERT_TRUE(reply.ok()) << reply.error;
  EXPECT_EQ(reply.body.find("PeerPid")->integer()->value, getpid());
  EXPECT_EQ(Text(reply.body, "PeerPath"), std::filesystem::read_symlink("/proc/self/exe").string());
  EXPECT_FALSE(reply.body.find("Entitlement"));

  EXPECT_EQ(client->Request({{"Command", "Ignore"}}, 100ms).status, ClientStatus::TimedOut);
  EXPECT_EQ(client->Request({{"Command", "Drop"}}, 3s).status, ClientStatus::Cancelled);
  lingering_ = Client::Connect(SocketPath());
  EXPECT_TRUE(lingering_->Request({{"Tag", "b"}}, 3s).ok());
}

// Two requests in one burst, trickled over about twice the partial-frame timeout and
// never silent for long: both are answered in order although the first is slow. (A
// reply to a request without an id carries none: the message unit test's.)
TEST_F(TransportTest, TrickledBurstIsAnsweredInOrder) {
  Start();
  Bytes burst = FrameOf({{"vexa.id", plist::Value::Int(10)}, {"Tag", "1"}, {"Command", "Slow"}});
  const Bytes second = FrameOf({{"vexa.id", plist::Value::Int(30)}, {"Tag", "2"}});
  burst.insert(burst.end(), second.begin(), second.end());
  RawPeer peer(ConnectToPath(SocketPath(), nullptr));
  const size_t step = burst.size() / 6 + 1;
  for (size_t pos = 0; pos < burst.size(); pos += step) {
    peer.Write(Bytes(burst.begin() + pos, burst.begin() + std::min(burst.size(), pos + step)));
    std::this_thread::sleep_for(100ms);
  }
  auto replies = peer.Read(2);
  ASSERT_TRUE(replies);
  ASSERT_EQ(replies->size(), 2u);
  EXPECT_EQ(Text((*replies)[0], "Tag"), "1");
  EXPECT_EQ((*replies)[0].find("vexa.reply-to")->integer()->value, 10);
  EXPECT_EQ(Text((*replies)[1], "Tag"), "2");
  EXPECT_EQ((*replies)[1].find("vexa.reply-to")->integer()->value, 30);
}

// One case per way a connection fails: the frame reader refuses (the ways it does are
// its own unit test's), the frame is no message, the frame never completes, the peer
// never reads its replies. Each is cancelled once; a bystander is served throughout.
TEST_F(TransportTest, MisbehavingPeersAreCancelledWithoutStallingOthers) {
  Start();
  Bytes hoard;  // requests whose replies outgrow the queue of a peer that never reads
  for (int i = 0; i < 64; ++i) {
    const Bytes big = FrameOf({{"Command", "Big"}});
    hoard.insert(hoard.end(), big.begin(), big.end());
  }
  const struct {
    const char* name;
    Bytes bytes;
  } cases[] = {
      {"garbage payload", {0, 0, 0, 5, 'h', 'e', 'l', 'l', 'o'}},
      {"id that is not an integer", FrameOf({{"vexa.id", "one"}})},
      {"half a frame, then silence", {0, 0, 0, 9, 'h', 'e', 'l'}},
      {"never reads its replies", hoard},
  };
  std::optional<Client> bystander = Client::Connect(SocketPath());
  ASSERT_TRUE(bystander);
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    const int invalidBefore = invalidEvents_;
    RawPeer bad(ConnectToPath(SocketPath(), nullptr));
    int one = 1;
    setsockopt(bad.fd.get(), SOL_SOCKET, SO_RCVBUF, &one, sizeof one);  // smallest the kernel allows
    bad.Write(c.bytes);
    EXPECT_TRUE(bystander->Request({{"Tag", "bystander"}}, 3s).ok());
    // Reading drains what was queued; only a cancelled connection then ends.
    EXPECT_TRUE(bad.ClosedWithin(2s));
    for (int i = 0; i < 1000 && invalidEvents_ == invalidBefore; ++i) std::this_thread::sleep_for(2ms);
    EXPECT_EQ(invalidEvents_, invalidBefore + 1);
    EXPECT_TRUE(bystander->Request({{"Tag", "bystander"}}, 3s).ok());
  }
  std::this_thread::sleep_for(50ms);
  EXPECT_EQ(invalidEvents_, int(std::size(cases))) << "one event per cancelled connection";
}

TEST_F(TransportTest, SocketActivationServesThePassedDescriptor) {
  const std::string activatedPath = scratch_.str() + "/activated";
  const int listening = ListenOnPath(activatedPath, nullptr).release();  // the service will own it
  ASSERT_GE(listening, 0);
  if (listening != 3) {  // where a launcher puts it
    ASSERT_EQ(dup2(listening, 3), 3);
    close(listening);
  }
  setenv("LISTEN_PID", std::to_string(getpid()).c_str(), 1);
  setenv("LISTEN_FDS", "1", 1);

  Start();
  EXPECT_EQ(getenv("LISTEN_PID"), nullptr);
  EXPECT_EQ(getenv("LISTEN_FDS"), nullptr);
  EXPECT_FALSE(std::filesystem::exists(SocketPath())) << "the passed socket replaces binding";
  std::optional<Client> client = Client::Connect(activatedPath);
  ASSERT_TRUE(client);
  EXPECT_TRUE(client->Request({{"Tag", "activated"}}, 3s).ok());
}

// Root only: trusted.* attributes and the events socket's peer check need it.
// A process connects as this program, then execs a copy that carries entitlements: the
// copy's own connection gets them, the one made before the exec does not.
TEST_F(TransportTest, EntitlementsAreThoseOfTheProgramThatConnected) {
  BRISVALE_REQUIRE_ROOT();
  const std::string tool = scratch_.str() + "/entitled-tool";
  std::filesystem::copy_file("/proc/self/exe", tool);  // executable, as the original is
  const std::string entitlements = plist::WriteXml(plist::Dictionary{{kEntitlementKey, EntitledSPIs()}});
  if (setxattr(tool.c_str(), "trusted.vexa.entitlements", entitlements.data(), entitlements.size(), 0) != 0) {
    GTEST_SKIP() << "trusted extended attributes unsupported here: " << strerror(errno);
  }
  log::CaptureSink capture;
  Start();
  const pid_t child = fork();
  if (child == 0) {
    // Served once as this program; then the copy takes the same connection over.
    std::optional<Client> client = Client::Connect(SocketPath());
    if (!client || !client->Request({{"Tag", "before the exec"}}, 3s).ok() || fcntl(client->fd(), F_SETFD, 0) != 0) {
      _exit(2);
    }
    const std::string inherited = std::to_string(client->fd());
    execl(tool.c_str(), tool.c_str(), "--peer", SocketPath().c_str(), inherited.c_str(), static_cast<char*>(nullptr));
    _exit(127);
  }
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0)
      << "the entitled copy was not named, did not receive its entitlement, or received it on the old connection";
  EXPECT_TRUE(capture.Contains(log::Level::Default, "Serving pid " + std::to_string(child) +
                                                        " without entitlements: it no longer runs the program "
                                                        "that connected"));
}

TEST_F(TransportTest, EventsFromRootPostersReachTheirStreamOnly) {
  BRISVALE_REQUIRE_ROOT();
  std::vector<std::optional<std::string>> received;
  std::mutex receivedMutex;
  Start([&] {
    streams_.push_back(service_->RegisterEventStream("com.example.wanted", [&](const StreamEvent& event) {
      std::lock_guard lock(receivedMutex);
      received.push_back(event.name);
    }));
  });

  const std::string events = EventsSocketPath(options_);
  EXPECT_TRUE(PostEvent(events, "com.example.wanted", "first").ok());
  EXPECT_TRUE(PostEvent(events, "com.example.other", "elsewhere").ok());

  const pid_t child = fork();
  if (child == 0) {
    if (setuid(65534) != 0) _exit(2);
    _exit(PostEvent(events, "com.example.wanted", "from a user", 2s).status == ClientStatus::Cancelled ? 0 : 1);
  }
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "a non-root poster was not refused";

  std::lock_guard lock(receivedMutex);
  EXPECT_EQ(received, (std::vector<std::optional<std::string>>{"first"}));
}

}  // namespace
}  // namespace brisvale::ipc

int main(int argc, char** argv) {
  if (argc == 4 && std::string_view(argv[1]) == "--peer") return brisvale::ipc::RunAsEntitledPeer(argv[2], argv[3]);
  ::testing::InitGoogleTest(&argc, argv);
  return RUN_ALL_TESTS();
}
