// A verified mount of a 512 MiB developer image through the daemon, against its floor
// in the same run: the SHA-1 of the file, LOOP_CONFIGURE and mount(2) done directly.
// And the identical-image answer against the digest alone. Needs root.
#include <fcntl.h>
#include <sys/mount.h>
#include <unistd.h>

#include <benchmark/benchmark.h>

#include <cstdio>
#include <filesystem>
#include <fstream>
#include <memory>

#include "base/unique_fd.h"
#include "platform/linux/loop_device.h"
#include "platform/os.h"
#include "platform/services.h"
#include "sandbox_daemon.h"
#include "verify/image_digest.h"

namespace {

using namespace brisvale;
namespace fs = std::filesystem;

// The digests read through the platform's file calls, as they do in the daemon.
const brisvale::ScopedServices systemOs(brisvale::Services{.os = &brisvale::os::SystemOs()});

constexpr const char* kVersion =
    "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><dict><key>ProductVersion</key>"
    "<string>21.4.1</string></dict></plist>\n";

struct Setup {
  brisvale::testing::SandboxDaemon daemon;
  std::string image, signature;
  bool ok = false;
  int staged = 0;

  Setup() {
    const std::string pki = BRISVALE_PKI_DIR, imgtool = BRISVALE_IMGTOOL;
    const std::string work = daemon.root() + ".bench";
    fs::create_directories(work + "/content/System/Library/Basalt");
    std::ofstream(work + "/content/System/Library/Basalt/SystemVersion.plist") << kVersion;
    fs::create_directories(daemon.Path("/System/Library/Basalt"));
    std::ofstream(daemon.Path("/System/Library/Basalt/SystemVersion.plist")) << kVersion;
    fs::create_directories(daemon.Path("/System/Library/Tethra"));
    fs::copy_file(pki + "/developer-signing.pem", daemon.Path("/System/Library/Tethra/CorvexDebug.pem"));
    fs::copy_file(pki + "/developer-ca.pem", daemon.Path("/System/Library/Tethra/CorvexCA.pem"));
    fs::create_directories(daemon.Path("/Developer"));
    // Real data, so the digest reads 512 MiB rather than holes.
    brisvale::testing::RunProgram({"/bin/sh", "-c", "head -c 480M /dev/urandom > " + work + "/content/payload"});
    image = work + "/image.img";
    signature = work + "/image.sig";
    ok = brisvale::testing::RunProgram({imgtool, "trust-cache", work + "/content", "-o", work + "/content/.TrustCache"}) == 0 &&
         brisvale::testing::RunProgram({"/bin/sh", "-c", "mkfs.ext4 -q -O ^has_journal -d " + work + "/content " + image +
                                                   " 512M"}) == 0 &&
         brisvale::testing::RunProgram({imgtool, "sign-developer", "--key", pki + "/developer-signing.key", "--image", image,
                              "-o", signature}) == 0 &&
         daemon.Start();
    if (!ok) std::fprintf(stderr, "bench set-up failed\n");
  }
  ~Setup() { fs::remove_all(daemon.root() + ".bench"); }

  // A copy of the image inside the sandbox, as the client stages it.
  std::string Stage() {
    const std::string inside = "/private/var/run/staging/" + std::to_string(++staged) + ".img";
    fs::create_directories(daemon.Path("/private/var/run/staging"));
    fs::copy_file(image, daemon.Path(inside));
    return inside;
  }

  bool Mount(const std::string& type, const std::string& inside, std::string* mountPath = nullptr) {
    std::ifstream file(signature, std::ios::binary);
    const plist::Bytes bytes((std::istreambuf_iterator<char>(file)), std::istreambuf_iterator<char>());
    std::optional<plist::Value> reply;
    daemon.SendRequest(plist::Dictionary{{"RequestType", "Mount"}, {"DeviceType", "DiskImage"},
                                         {"DiskImageType", plist::Value(type)},
                                         {"ImageSignature", plist::Value(bytes)},
                                         {"DiskImagePath", plist::Value(inside)}},
                       &reply);
    const std::string* status = reply ? reply->getString("Status") : nullptr;
    if (mountPath && reply && reply->getString("MountPath")) *mountPath = *reply->getString("MountPath");
    return status && *status == "Success";
  }

  void Unmount(const std::string& mountPath) {
    std::optional<plist::Value> reply;
    daemon.SendRequest(plist::Dictionary{{"RequestType", "Unmount"}, {"MountPath", plist::Value(mountPath)}}, &reply);
  }
};

Setup& Shared() {
  static Setup setup;
  return setup;
}

void BM_MountThroughDaemon(benchmark::State& state) {
  Setup& setup = Shared();
  if (!setup.ok) return state.SkipWithError("set-up failed");
  for (auto _ : state) {
    state.PauseTiming();
    const std::string inside = setup.Stage();
    state.ResumeTiming();
    if (!setup.Mount("Developer", inside)) state.SkipWithError("mount failed");
    state.PauseTiming();
    setup.Unmount("/Developer");
    state.ResumeTiming();
  }
}

void BM_MountFloor(benchmark::State& state) {
  Setup& setup = Shared();
  const std::string target = setup.daemon.root() + ".floor";
  fs::create_directories(target);
  for (auto _ : state) {
    state.PauseTiming();
    const std::string inside = setup.Stage();
    const std::string staged = setup.daemon.Path(inside);
    state.ResumeTiming();
    benchmark::DoNotOptimize(verify::DigestFileSha1(staged));
    const UniqueFd file(::open(staged.c_str(), O_RDONLY | O_CLOEXEC));
    loop::LoopDevice device;
    if (loop::Attach(file.get(), {}, device) != 0) state.SkipWithError("attach failed");
    const std::string node = "/dev/" + device.name();
    if (::mount(node.c_str(), target.c_str(), "ext4", MS_RDONLY | MS_NOSUID | MS_NODEV, nullptr) != 0) {
      state.SkipWithError("mount failed");
    }
    state.PauseTiming();
    ::umount2(target.c_str(), 0);
    device.Detach();
    fs::remove(staged);
    state.ResumeTiming();
  }
  fs::remove(target);
}

void BM_IdenticalImageAnswer(benchmark::State& state) {
  Setup& setup = Shared();
  // Staged the way brisvalectl does it, so the mounted image's signature is known.
  std::string mountPath;
  const auto digest = verify::DigestFileSha1(setup.image);
  std::string hex;
  for (uint8_t byte : *digest) {
    char text[3];
    std::snprintf(text, sizeof text, "%02X", byte);
    hex += text;
  }
  const std::string first = "/private/var/run/staging/" + hex.substr(0, 2) + "/" + hex.substr(2) + "/image.img";
  fs::create_directories(setup.daemon.Path(first).substr(0, setup.daemon.Path(first).rfind('/')));
  fs::copy_file(setup.image, setup.daemon.Path(first));
  if (!setup.Mount("Factory", first, &mountPath)) state.SkipWithError("first mount failed");
  for (auto _ : state) {
    state.PauseTiming();
    const std::string inside = setup.Stage();
    state.ResumeTiming();
    if (!setup.Mount("Factory", inside)) state.SkipWithError("identical answer failed");
  }
  setup.Unmount(mountPath);
}

void BM_DigestAlone(benchmark::State& state) {
  Setup& setup = Shared();
  for (auto _ : state) {
    state.PauseTiming();
    const std::string staged = setup.daemon.Path(setup.Stage());
    state.ResumeTiming();
    benchmark::DoNotOptimize(verify::DigestFileSha1(staged));
    state.PauseTiming();
    fs::remove(staged);
    state.ResumeTiming();
  }
}

BENCHMARK(BM_MountThroughDaemon)->Unit(benchmark::kMillisecond)->Iterations(5)->UseRealTime();
BENCHMARK(BM_MountFloor)->Unit(benchmark::kMillisecond)->Iterations(5)->UseRealTime();
BENCHMARK(BM_IdenticalImageAnswer)->Unit(benchmark::kMillisecond)->Iterations(5)->UseRealTime();
BENCHMARK(BM_DigestAlone)->Unit(benchmark::kMillisecond)->Iterations(5)->UseRealTime();

}  // namespace
