// From a posted "attached" hardware event to the "com.vantrel.brisvale_mounted"
// notification for one HFS+ stick while 32 other media are attached and mounted. The
// check, repair and mount tools answer at once (the mount tool's mount appears in the
// mount table as it returns), so the figures are the daemon's own time without the
// tools'. Reports p50 and p99 over all iterations.
#include <benchmark/benchmark.h>

#include <algorithm>
#include <chrono>

#include "base/log.h"
#include "base/runloop.h"
#include "daemon/daemon.h"
#include "fake_os.h"
#include "platform/ipc_service.h"
#include "platform/services.h"
#include "platform/system_notify.h"
#include "registry/registry_model.h"

namespace brisvale {
namespace {

using Clock = std::chrono::steady_clock;

class InstantToolsOs : public testing::FakeOs {
 public:
  int SpawnProgram(const std::vector<std::string>& argv) override {
    if (argv[0] == "/sbin/mount_hfs") {
      mounts.push_back({0, "hfsplus", "/private" + argv.back(), argv[argv.size() - 2]});
    }
    return 4242;
  }
  int WaitForChild(int, int& waitStatus) override {
    waitStatus = 0;
    return 0;
  }
  int StatPath(const char* path, os::FileStatus&) override {
    return std::find(directories.begin(), directories.end(), path) != directories.end() ? 0 : -ENOENT;
  }
  int MakeDirectory(const char* path, uint32_t) override {
    if (std::find(directories.begin(), directories.end(), path) != directories.end()) return -EEXIST;
    directories.emplace_back(path);
    return 0;
  }
  int ChangeMode(const char*, uint32_t) override { return 0; }
  int RealPath(const char* path, std::string& resolved) override {
    resolved = std::string("/private") + path;
    return 0;
  }
  std::vector<std::string> directories;
};

class NullIpc : public ipc::IpcService {
 public:
  std::unique_ptr<ipc::Listener> CreateListener(std::string_view) override { return nullptr; }
  std::unique_ptr<ipc::EventStream> RegisterEventStream(
      std::string_view, std::function<void(const ipc::StreamEvent&)>) override {
    return nullptr;
  }
  void BeginTransaction() override {}
  void EndTransaction() override {}
  int TransactionCount() const override { return 0; }
};

class DiscardSink : public log::Sink {
 public:
  void Write(log::Level, std::string_view) override {}
};

class MountedClock : public notify::SystemNotify {
 public:
  void Post(const notify::Notification& notification) override {
    if (notification.name == "com.vantrel.brisvale_mounted") posted = Clock::now();
  }
  Clock::time_point posted;
};

std::vector<uint8_t> HfsPlusHeader() {
  std::vector<uint8_t> header(1028, 0);
  header[1024] = 'H', header[1025] = '+', header[1027] = 4;
  return header;
}

plist::Dictionary Stick(const std::string& bsdName) {
  return {{"BSD Name", plist::Value(bsdName)}, {"Content", plist::Value("48465300-0000-11AA-AA11-00306543ECAC")},
          {"Removable", plist::Value::Bool(true)}, {"Leaf", plist::Value::Bool(true)},
          {"Writable", plist::Value::Bool(true)}};
}

void BM_AttachedEventToMountedNotification(benchmark::State& state) {
  DiscardSink discard;
  log::Sink* previousSink = log::SetSink(&discard);
  registry::RegistryModel registry;
  InstantToolsOs os;
  NullIpc ipc;
  MountedClock notifier;
  ScopedServices services(Services{&registry, &os, &ipc, &notifier});
  RunLoop loop;
  MatchingContext context;
  context.notificationPort = std::move(registry.CreateNotificationPort().value);
  Daemon daemon(loop, context, [](int) {});

  auto usb = registry.Publish(nullptr, "KxUSBHostDevice", {{"removable", plist::Value::Bool(true)}});
  for (int i = 0; i < 32; ++i) {
    const std::string name = "sdo" + std::to_string(i);
    registry.Publish(usb, "KxMedia", Stick(name));
    os.mounts.push_back({0, "hfsplus", "/private/var/mnt/other" + std::to_string(i), "/dev/" + name});
  }
  registry.Publish(usb, "KxMedia", Stick("sdz1"));
  os.volumeHeaders["/dev/sdz1"] = HfsPlusHeader();
  const std::vector<os::MountRecord> othersOnly = os.mounts;
  const ipc::StreamEvent attached{std::string(kMediaAttachedEvent)};

  std::vector<double> micros;
  for (auto _ : state) {
    os.mounts = othersOnly;
    os.directories.clear();
    const Clock::time_point start = Clock::now();
    daemon.HandleHardwareEvent(attached);
    if (notifier.posted < start) {
      state.SkipWithError("the stick was not mounted");
      break;
    }
    micros.push_back(std::chrono::duration<double, std::micro>(notifier.posted - start).count());
  }
  log::SetSink(previousSink);
  if (micros.empty()) return;
  std::sort(micros.begin(), micros.end());
  state.counters["p50_us"] = micros[micros.size() / 2];
  state.counters["p99_us"] = micros[std::min(micros.size() - 1, micros.size() * 99 / 100)];
}
BENCHMARK(BM_AttachedEventToMountedNotification)->Unit(benchmark::kMicrosecond);

}  // namespace
}  // namespace brisvale
