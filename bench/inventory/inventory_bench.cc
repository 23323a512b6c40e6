// "CopyDevices" round trip with a full house: 64 loop-mounted images under the mount
// roots and 32 simulated USB sticks, in a sandbox root. Every call rebuilds the whole
// list, so this is the price of one listing. Reports p50 and p99 besides the mean.
#include <benchmark/benchmark.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <fstream>

#include "loop_mount.h"
#include "sandbox_daemon.h"

namespace brisvale {
namespace {

namespace fs = std::filesystem;
using brisvale::testing::LoopMount;
using brisvale::testing::SandboxDaemon;

constexpr int kMounts = 64;
constexpr int kSticks = 32;

struct FullHouse {
  std::unique_ptr<SandboxDaemon> daemon = std::make_unique<SandboxDaemon>();
  std::vector<std::unique_ptr<LoopMount>> mounts;
  std::string error;

  bool Build() {
    // Sticks: a USB device with one FAT partition each, node under the device root.
    plist::Array objects;
    for (int i = 0; i < kSticks; ++i) {
      const std::string name = "sdb" + std::to_string(i + 1);
      plist::Dictionary media{{"BSD Name", plist::Value(name)},   {"Content", "0x0C"},
                              {"Removable", plist::Value::Bool(true)}, {"Leaf", plist::Value::Bool(true)},
                              {"Writable", plist::Value::Bool(true)}};
      objects.push_back(plist::Dictionary{
          {"Name", plist::Value("stick" + std::to_string(i))},
          {"Class", "KxUSBHostDevice"},
          {"Properties", plist::Dictionary{{"removable", plist::Value::Bool(true)}}},
          {"Children", plist::Array{plist::Dictionary{{"Name", "media"}, {"Class", "KxMedia"},
                                                      {"Properties", plist::Value(media)}}}}});
    }
    std::ofstream(daemon->root() + "/devices.plist") << plist::WriteXml(plist::Dictionary{{"Objects", objects}});
    if (!daemon->Start({"--devices", "/devices.plist"})) return Fail("daemon did not start");
    const std::string sector = std::string("\xEB\x3C\x90MSDOS5.0", 11) + std::string(4096, '\0');
    for (int i = 0; i < kSticks; ++i) {
      std::ofstream(daemon->Path("/dev/sdb" + std::to_string(i + 1)), std::ios::binary) << sector;
    }

    // Images: one ext4 image copied, each copy below its own signature directories,
    // mounted across three roots.
    const std::string master = daemon->Path("/master.img");
    if (!testing::MakeExt4Image(master, 1, "", &error)) return false;
    const char* roots[] = {"/private/var/mnt/m", "/private/var/personalized_debug/p", "/private/var/factory_mount/f"};
    for (int i = 0; i < kMounts; ++i) {
      const std::string dir = daemon->Path("/private/var/run/images/AB" + std::to_string(10 + i) + "/CD");
      const std::string mountPoint = daemon->Path(roots[i % 3] + std::to_string(i));
      fs::create_directories(dir);
      fs::create_directories(mountPoint);
      fs::copy_file(master, dir + "/image.img");
      auto mount = LoopMount::Create(dir + "/image.img", mountPoint, daemon->Path("/dev"), true, &error);
      if (!mount) return false;
      mounts.push_back(std::move(mount));
    }
    return true;
  }
  bool Fail(std::string what) {
    error = std::move(what);
    return false;
  }
};

void BM_CopyDevicesFullHouse(benchmark::State& state) {
  if (geteuid() != 0) return state.SkipWithError("needs root");
  FullHouse house;
  if (!house.Build()) return state.SkipWithError(house.error.c_str());
  std::optional<ipc::Client> client = ipc::Client::Connect(house.daemon->ServiceSocket());
  if (!client) return state.SkipWithError("cannot connect");
  plist::Dictionary request{
      {"EncodedDictionary", plist::Value(plist::WriteBinary(plist::Dictionary{{"RequestType", "CopyDevices"}}))}};

  // One listing first, to check that everything is there.
  ipc::ClientReply first = client->Request(request, std::chrono::seconds(10));
  const plist::Value* encoded = first.ok() ? first.body.find("EncodedDictionary") : nullptr;
  std::optional<plist::Value> reply = encoded && encoded->data() ? plist::ReadBinary(*encoded->data()) : std::nullopt;
  const plist::Value* list = reply ? reply->get("EntryList") : nullptr;
  if (!list || !list->array() || list->array()->size() != kMounts + kSticks) {
    return state.SkipWithError("the listing does not hold every device");
  }

  std::vector<double> micros;
  for (auto _ : state) {
    const auto start = std::chrono::steady_clock::now();
    ipc::ClientReply answer = client->Request(request, std::chrono::seconds(10));
    micros.push_back(std::chrono::duration<double, std::micro>(std::chrono::steady_clock::now() - start).count());
    if (!answer.ok()) return state.SkipWithError(answer.error.c_str());
  }
  std::sort(micros.begin(), micros.end());
  state.counters["p50_us"] = micros[micros.size() / 2];
  state.counters["p99_us"] = micros[std::min(micros.size() - 1, micros.size() * 99 / 100)];
  state.counters["entries"] = static_cast<double>(list->array()->size());
}
BENCHMARK(BM_CopyDevicesFullHouse)->UseRealTime()->Unit(benchmark::kMicrosecond)->Iterations(2000);
BENCHMARK(BM_CopyDevicesFullHouse)->Name("BM_CopyDevicesLong")->UseRealTime()->Unit(benchmark::kMicrosecond)->Iterations(20000);

}  // namespace
}  // namespace brisvale
