// Removable media in a sandbox root: installing the tool doubles and placing simulated volumes.
#include "media_doubles.h"

#include <filesystem>

namespace brisvale::testing {

namespace fs = std::filesystem;

bool InstallToolDoubles(const SandboxDaemon& daemon) {
  std::error_code error;
  fs::create_directories(daemon.Path("/sbin"), error);
  for (const char* tool : {"fsck_hfs", "mount_hfs"}) {
    fs::copy_file(fs::path(BRISVALE_DOUBLES_DIR) / tool, daemon.Path(std::string("/sbin/") + tool),
                  fs::copy_options::overwrite_existing, error);
    if (error) return false;
  }
  return true;
}

bool PlaceVolume(const SandboxDaemon& daemon, const std::string& bsdName, const std::string& kind,
                 const std::string& marker) {
  std::error_code error;
  fs::create_directories(daemon.Path("/dev"), error);
  std::vector<std::string> argv{std::string(BRISVALE_DOUBLES_DIR) + "/make-volume", daemon.Path("/dev/" + bsdName),
                                kind};
  if (!marker.empty()) argv.push_back(marker);
  return RunProgram(argv) == 0;
}

}  // namespace brisvale::testing
