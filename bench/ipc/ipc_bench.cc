// A request round trip through the transport (client encode, socket, loop, frame
// reader, echo handler, reply queue, client decode) against the floor: the same frame
// bytes echoed by a thread on a plain Unix socket pair.
#include <sys/socket.h>
#include <unistd.h>

#include <benchmark/benchmark.h>

#include <thread>

#include "base/runloop.h"
#include "platform/linux/ipc_client.h"
#include "platform/linux/ipc_frame.h"
#include "platform/linux/ipc_linux.h"
#include "platform/linux/ipc_message.h"
#include "test_files.h"

namespace brisvale::ipc {
namespace {

plist::Dictionary TypicalRequest() {
  const plist::Bytes encoded = plist::WriteBinary(plist::Dictionary{{"RequestType", "CopyDevices"}});
  return {{"EncodedDictionary", plist::Value(encoded)}};
}

void BM_TransportRoundTrip(benchmark::State& state) {
  const brisvale::testing::ScratchDir scratch;
  IpcOptions options;
  options.socketDirectory = scratch.str();
  options.kernelDeviceEvents = false;
  RunLoop loop;
  std::unique_ptr<IpcService> service = CreateLinuxIpcService(loop, options);
  std::unique_ptr<Listener> listener = service->CreateListener("echo");
  if (!listener) return state.SkipWithError("cannot listen");
  listener->Resume([](std::shared_ptr<Connection> connection, EventKind) {
    std::weak_ptr<Connection> weak = connection;
    connection->Resume([weak](EventKind kind, const Message* message) {
      auto connection = weak.lock();
      if (kind != EventKind::Message || !connection) return;
      Message reply = *CreateReply(*message);
      reply.body = message->body;
      connection->Send(reply);
    });
  });
  std::thread thread([&] { loop.Run(); });

  std::optional<Client> client = Client::Connect(ServiceSocketPath(options, "echo"));
  const plist::Dictionary request = TypicalRequest();
  for (auto _ : state) {
    ClientReply reply = client->Request(request, std::chrono::seconds(5));
    if (!reply.ok()) {
      state.SkipWithError(reply.error.c_str());
      break;
    }
    benchmark::DoNotOptimize(reply);
  }
  client.reset();
  loop.Stop();
  thread.join();
  listener.reset();
  service.reset();
}
BENCHMARK(BM_TransportRoundTrip)->UseRealTime();

bool ReadFully(int fd, uint8_t* data, size_t size) {
  while (size > 0) {
    const ssize_t n = read(fd, data, size);
    if (n <= 0) return false;
    data += n;
    size -= size_t(n);
  }
  return true;
}

bool WriteFully(int fd, const uint8_t* data, size_t size) {
  while (size > 0) {
    const ssize_t n = write(fd, data, size);
    if (n <= 0) return false;
    data += n;
    size -= size_t(n);
  }
  return true;
}

void BM_BareSocketEcho(benchmark::State& state) {
  int fds[2];
  if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) != 0) return state.SkipWithError("socketpair");
  Message message;
  message.body = TypicalRequest();
  message.replyToken = plist::Integer{1, false};
  const plist::Bytes frame = *EncodeFrame(FrameFromMessage(message));

  std::thread echo([fd = fds[1]] {
    plist::Bytes buffer;
    uint8_t header[4];
    while (ReadFully(fd, header, 4)) {
      const size_t length = (size_t(header[0]) << 24) | (size_t(header[1]) << 16) | (size_t(header[2]) << 8) | header[3];
      buffer.resize(4 + length);
      std::copy(header, header + 4, buffer.begin());
      if (!ReadFully(fd, buffer.data() + 4, length) || !WriteFully(fd, buffer.data(), buffer.size())) break;
    }
  });
  plist::Bytes back(frame.size());
  for (auto _ : state) {
    if (!WriteFully(fds[0], frame.data(), frame.size()) || !ReadFully(fds[0], back.data(), back.size())) {
      state.SkipWithError("echo failed");
      break;
    }
  }
  shutdown(fds[0], SHUT_RDWR);
  echo.join();
  close(fds[0]);
  close(fds[1]);
}
BENCHMARK(BM_BareSocketEcho)->UseRealTime();

}  // namespace
}  // namespace brisvale::ipc
