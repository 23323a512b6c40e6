// brisvale-mounterd: the composition root. Builds the Linux implementations of the
// platform interfaces, optionally enters a sandbox root, and runs the daemon.
#include <sys/resource.h>

#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <optional>
#include <string>

#include "base/log.h"
#include "base/runloop.h"
#include "daemon/daemon.h"
#include "daemon/matching_context.h"
#include "daemon/stale_mount_points.h"
#include "platform/linux/alert_linux.h"
#include "platform/linux/ipc_linux.h"
#include "platform/linux/jobs_spool.h"
#include "platform/linux/notify_center.h"
#include "platform/linux/os_sandbox.h"
#include "platform/linux/registry_disk_images.h"
#include "platform/os.h"
#include "platform/services.h"
#include "platform/linux/system_devices.h"
#include "registry/registry_model.h"
#include "registry/simulated_devices.h"

namespace {

constexpr int kExitUsage = 2;
constexpr int kExitSetup = 3;

struct Options {
  std::optional<std::string> root;
  std::optional<std::string> devicesFile;
  bool teardown = false;
  bool verbose = false;
  std::optional<std::chrono::milliseconds> keepAlive;
};

void PrintUsage(FILE* out) {
  std::fputs(
      "usage: brisvale-mounterd [--root DIR [--teardown]] [--devices FILE] [--verbose]\n"
      "  --root DIR      run chrooted in the sandbox root DIR (made ready first)\n"
      "  --teardown      with --root: unmount everything under DIR, detach its loop\n"
      "                  devices and remove DIR, then exit\n"
      "  --devices FILE  publish the simulated devices described in FILE\n"
      "  --verbose       log debug lines\n"
      "  --test-keep-alive-ms MS\n"
      "                  tests only: hold each subscription's keep-alive for MS\n"
      "                  milliseconds instead of 15 seconds\n",
      out);
}

std::optional<Options> ParseOptions(int argc, char** argv) {
  Options options;
  for (int i = 1; i < argc; ++i) {
    std::string arg = argv[i];
    auto value = [&]() -> std::optional<std::string> {
      if (i + 1 >= argc) return std::nullopt;
      return std::string(argv[++i]);
    };
    if (arg == "--root") {
      if (!(options.root = value())) return std::nullopt;
    } else if (arg == "--devices") {
      if (!(options.devicesFile = value())) return std::nullopt;
    } else if (arg == "--teardown") {
      options.teardown = true;
    } else if (arg == "--test-keep-alive-ms") {
      std::optional<std::string> text = value();
      char* end = nullptr;
      const long milliseconds = text ? std::strtol(text->c_str(), &end, 10) : 0;
      if (!text || text->empty() || *end != '\0' || milliseconds <= 0 || milliseconds > 3'600'000) {
        return std::nullopt;
      }
      options.keepAlive = std::chrono::milliseconds(milliseconds);
    } else if (arg == "--verbose" || arg == "-v") {
      options.verbose = true;
    } else if (arg == "--help" || arg == "-h") {
      PrintUsage(stdout);
      std::exit(0);
    } else {
      std::fprintf(stderr, "brisvale-mounterd: unknown argument '%s'\n", arg.c_str());
      return std::nullopt;
    }
  }
  if (options.teardown && !options.root) return std::nullopt;
  return options;
}

}  // namespace

int main(int argc, char** argv) {
  using namespace brisvale;
  std::optional<Options> options = ParseOptions(argc, argv);
  if (!options) {
    PrintUsage(stderr);
    return kExitUsage;
  }
  if (options->verbose || std::getenv("BRISVALE_DEBUG")) log::SetDebugEnabled(true);
  std::signal(SIGPIPE, SIG_IGN);
  // Every client connection holds descriptors: take all the hard limit allows, so the
  // soft default of 1024 does not decide how many clients can wait at once.
  if (rlimit files{}; getrlimit(RLIMIT_NOFILE, &files) == 0 && files.rlim_cur < files.rlim_max) {
    files.rlim_cur = files.rlim_max;
    setrlimit(RLIMIT_NOFILE, &files);
  }

  std::string error;
  if (options->root && options->teardown) {
    if (!linux_os::TeardownSandboxRoot(*options->root, &error)) {
      std::fprintf(stderr, "brisvale-mounterd: teardown of %s failed: %s\n",
                   options->root->c_str(), error.c_str());
      return kExitSetup;
    }
    return 0;
  }
  // A daemon killed between attaching an image and mounting it left the loop device
  // attached; nothing else would ever detach it. Done before entering the root, while
  // the images' paths read as the kernel shows them.
  if (char* root = ::realpath(options->root ? options->root->c_str() : "/", nullptr)) {
    registry::DetachAbandonedImageDevices(root);
    std::free(root);
  }
  if (options->root) {
    // Once inside, the root gets the localization bundle an installed system has.
    if (!linux_os::EnterSandboxRoot(*options->root, &error) ||
        !alert::InstallLocalizationBundle("", &error)) {
      std::fprintf(stderr, "brisvale-mounterd: cannot use %s as sandbox root: %s\n",
                   options->root->c_str(), error.c_str());
      return kExitSetup;
    }
  } else if (!linux_os::CheckFilesystemLayout(&error)) {
    std::fprintf(stderr, "brisvale-mounterd: %s\n", error.c_str());
    return kExitSetup;
  }

  RunLoop loop;
  registry::RegistryModel registry;
  std::unique_ptr<registry::SystemDevices> systemDevices =
      registry::StartSystemDevices(registry, &loop, registry::SystemDevicesOptions{});
  registry::DiskImageServicesOptions diskImageOptions;
  diskImageOptions.rescanDevices = [&systemDevices] {
    if (systemDevices) systemDevices->Rescan();
  };
  registry::DiskImageServices diskImages(registry, std::move(diskImageOptions));
  std::optional<registry::SimulatedDevices> simulatedDevices;
  if (options->devicesFile) {
    simulatedDevices.emplace(registry, *options->devicesFile);
    if (!simulatedDevices->Reload(&error)) {
      std::fprintf(stderr, "brisvale-mounterd: cannot read %s: %s\n",
                   options->devicesFile->c_str(), error.c_str());
      return kExitUsage;
    }
  }
  IpcOptions ipcOptions;
  ipcOptions.transactionCountPath = ipcOptions.socketDirectory + "/brisvale-mounterd.transactions";
  std::unique_ptr<ipc::IpcService> ipc = CreateLinuxIpcService(loop, ipcOptions);
  std::unique_ptr<notify::SystemNotify> notifier = notify::CreateLinuxSystemNotify();
  jobs::SpoolJobLauncher jobLauncher;
  std::unique_ptr<alert::UserAlertService> alerts = alert::CreateLinuxUserAlertService(loop);
  ScopedServices services(Services{&registry, &os::SystemOs(), ipc.get(), notifier.get(),
                                   alerts.get(), &jobLauncher});

  // Without the port no media or camera notification could ever arrive: a daemon that
  // cannot create it would serve requests but silently ignore hardware, so it stops.
  BackgroundQueue backgroundQueue;
  MatchingContext context;
  context.backgroundQueue = &backgroundQueue;
  if (options->keepAlive) context.keepAlive = *options->keepAlive;
  auto port = registry.CreateNotificationPort();
  if (!port.ok() || !port.value) {
    Log(Level::Default, "Failed to create registry notification port: 0x%04x",
        port.status & 0x3FFF);
    return 1;
  }
  context.notificationPort = std::move(port.value);
  context.notificationPort->Attach(loop);

  for (const char* root : kStaleMountRoots) RemoveStaleMountPoints(root);

  Daemon daemon(loop, context, [](int status) { std::exit(status); });
  if (!daemon.StartServing()) return 1;
  loop.Run();
  return 0;
}
