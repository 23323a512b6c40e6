#include "media/hfs_mount.h"

#include <cerrno>
#include <cstdio>

#include "base/log.h"
#include "media/fs_check.h"
#include "platform/os.h"
#include "platform/services.h"

namespace brisvale {
namespace {

constexpr const char* kMountRoot = "/var/mnt";
constexpr int kMountPointCount = 4;
constexpr uint32_t kMountPointMode = 0777;

// mkdir applies the umask; mount points must be usable by everyone.
int MakeOpenDirectory(os::Os& system, const char* path) {
  if (const int error = system.MakeDirectory(path, kMountPointMode); error < 0) return error;
  return system.ChangeMode(path, kMountPointMode);
}

}  // namespace

int MountHFSDevice(const char* devicePath, std::string& mountPath, FsType type, bool readOnly) {
  os::Os& system = *CurrentServices().os;
  if (const int error = MakeOpenDirectory(system, kMountRoot); error < 0 && error != -EEXIST) {
    Log(Level::Default, "Failed to create %s: %{errno}d", kMountRoot, -error);
    return -1;
  }

  bool found = false;
  for (int n = 1; n <= kMountPointCount && !found; ++n) {
    char candidate[1024];
    std::snprintf(candidate, sizeof candidate, "%s/mount%d", kMountRoot, n);
    os::FileStatus status;
    // Only "does not exist" frees a number; any other answer passes it over.
    if (system.StatPath(candidate, status) == -ENOENT) {
      mountPath = candidate;
      found = true;
    }
  }
  if (!found) {
    Log(Level::Default, "Failed to determine mount path.");
    return -1;
  }
  if (const int error = MakeOpenDirectory(system, mountPath.c_str()); error < 0) {
    Log(Level::Default, "Failed to create %s: %{errno}d", mountPath.c_str(), -error);
    return -1;
  }

  switch (type) {
    case FsTypeExFAT:
      Log(Level::Default, "Mounting of MSDOS EXFAT devices is unsupported.");
      return -1;
    case FsTypeFAT:
      Log(Level::Default, "Mounting of MSDOS devices is unsupported.");
      return -1;
    case FsTypeHFSPlus:
    case FsTypeHFSX:  // the same tool and driver mount both
      break;
    default:
      Log(Level::Default, "Unknown filesystem type: %d", static_cast<int>(type));
      return -1;
  }
  Log(Level::Debug, "Mounting the %s filesystem %s on %s", FsTypeLabel(type), devicePath, mountPath.c_str());
  std::string device(devicePath);
  if (device.size() > 1023) device.resize(1023);
  const char* option = readOnly ? "rdonly" : "noowners";
  if (RunToolAndWait({"/sbin/mount_hfs", "-o", option, device, mountPath}) != 0) {
    Log(Level::Default, "Failed to mount %s on %s.", devicePath, mountPath.c_str());
    return -1;
  }
  return 0;
}

}  // namespace brisvale
