// The daemon as a client sees it: start-up to listening, idle memory, and the request
// round trip over its socket against a bare echo of the same bytes over a Unix socket.
// Needs root (the daemon runs in a sandbox root).
#include <signal.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <benchmark/benchmark.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <fstream>
#include <memory>
#include <thread>

#include "platform/linux/ipc_client.h"
#include "platform/linux/ipc_frame.h"
#include "sandbox_daemon.h"

namespace {

using namespace brisvale;
using brisvale::testing::SandboxDaemon;

plist::Dictionary SyncRequest() {
  return plist::Dictionary{
      {"EncodedDictionary",
       plist::Value(plist::WriteBinary(
           plist::Dictionary{{"RequestType", "Sync"}, {"MountPath", "/private/var/mnt/none"}}))}};
}

std::string StatusField(pid_t pid, const std::string& field) {
  std::ifstream status("/proc/" + std::to_string(pid) + "/status");
  for (std::string line; std::getline(status, line);) {
    if (line.rfind(field + ":", 0) == 0) return line.substr(field.size() + 1);
  }
  return "?";
}

SandboxDaemon* SharedDaemon() {
  static std::unique_ptr<SandboxDaemon> daemon = [] {
    auto started = std::make_unique<SandboxDaemon>();
    if (!started->Start()) std::fprintf(stderr, "daemon did not start\n");
    return started;
  }();
  return daemon.get();
}

void BM_DaemonStartToListening(benchmark::State& state) {
  if (geteuid() != 0) return state.SkipWithError("needs root");
  for (auto _ : state) {
    state.PauseTiming();
    SandboxDaemon daemon;
    state.ResumeTiming();
    if (!daemon.Start()) return state.SkipWithError("daemon did not start");
    state.PauseTiming();
    daemon.Stop();
    state.ResumeTiming();
  }
}
BENCHMARK(BM_DaemonStartToListening)->Unit(benchmark::kMillisecond)->Iterations(10);

void BM_DaemonIdleMemory(benchmark::State& state) {
  if (geteuid() != 0) return state.SkipWithError("needs root");
  SandboxDaemon* daemon = SharedDaemon();
  for (auto _ : state) benchmark::DoNotOptimize(daemon->pid());
  std::string rss = StatusField(daemon->pid(), "VmRSS");
  std::string anon = StatusField(daemon->pid(), "RssAnon");
  state.SetLabel("VmRSS" + rss + ", RssAnon" + anon);
  state.counters["VmRSS_kB"] = std::atof(rss.c_str());
  state.counters["RssAnon_kB"] = std::atof(anon.c_str());
}
BENCHMARK(BM_DaemonIdleMemory)->Iterations(1);

void BM_DaemonRoundTrip(benchmark::State& state) {
  if (geteuid() != 0) return state.SkipWithError("needs root");
  std::optional<ipc::Client> client = ipc::Client::Connect(SharedDaemon()->ServiceSocket());
  if (!client) return state.SkipWithError("cannot connect");
  plist::Dictionary request = SyncRequest();
  for (auto _ : state) {
    ipc::ClientReply reply = client->Request(request, std::chrono::seconds(10));
    if (!reply.ok()) return state.SkipWithError(reply.error.c_str());
  }
}
BENCHMARK(BM_DaemonRoundTrip)->UseRealTime();

// The same request frame and a reply frame of the daemon's size, echoed by a process
// that only reads and writes: the floor any transport over a Unix socket has.
void BM_BareUnixEcho(benchmark::State& state) {
  int sockets[2];
  if (socketpair(AF_UNIX, SOCK_STREAM, 0, sockets) != 0) return state.SkipWithError("socketpair");
  std::optional<plist::Bytes> frame = ipc::EncodeFrame(SyncRequest());
  pid_t echo = fork();
  if (echo == 0) {
    close(sockets[0]);
    std::vector<uint8_t> buffer(1 << 16);
    for (ssize_t n; (n = read(sockets[1], buffer.data(), buffer.size())) > 0;) {
      if (write(sockets[1], buffer.data(), n) != n) break;
    }
    _exit(0);
  }
  close(sockets[1]);
  std::vector<uint8_t> buffer(frame->size());
  for (auto _ : state) {
    if (write(sockets[0], frame->data(), frame->size()) != static_cast<ssize_t>(frame->size())) break;
    size_t got = 0;
    while (got < frame->size()) {
      ssize_t n = read(sockets[0], buffer.data() + got, frame->size() - got);
      if (n <= 0) break;
      got += n;
    }
  }
  close(sockets[0]);
  waitpid(echo, nullptr, 0);
}
BENCHMARK(BM_BareUnixEcho)->UseRealTime();

}  // namespace
