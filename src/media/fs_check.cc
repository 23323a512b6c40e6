#include "media/fs_check.h"

#include "base/log.h"
#include "platform/os.h"
#include "platform/services.h"

namespace brisvale {
namespace {

constexpr const char* kChecker = "/sbin/fsck_hfs";

bool IsHfs(FsType type) { return type == FsTypeHFSPlus || type == FsTypeHFSX; }

// FAT and exFAT have no checker; the text is shared, the level is the caller's.
bool LogUncheckedKind(FsType type, Level fatLevel) {
  if (type == FsTypeExFAT) {
    Log(fatLevel, "We don't fsck MSDOS EXFAT filesystems.");
  } else if (type == FsTypeFAT) {
    Log(fatLevel, "We don't fsck MSDOS filesystems.");
  } else {
    Log(Level::Default, "Unknown filesystem type: %d", static_cast<int>(type));
  }
  return true;
}

// The checker gets its own copy of the path, bounded like every path the daemon builds.
std::string BoundedPath(const char* devicePath) {
  std::string path(devicePath);
  if (path.size() > 1023) path.resize(1023);
  return path;
}

}  // namespace

int32_t RunToolAndWait(const std::vector<std::string>& argv) {
  os::Os& system = *CurrentServices().os;
  const int pid = system.SpawnProgram(argv);
  if (pid < 0) {
    Log(Level::Default, "Failed to spawn %s : %{errno}d", argv.empty() ? "" : argv[0].c_str(), -pid);
    return -1;
  }
  int waitStatus = 0;
  if (const int error = system.WaitForChild(pid, waitStatus); error < 0) {
    Log(Level::Default, "Failed to wait for pid %d: %{errno}d", pid, -error);
    return -1;
  }
  if ((waitStatus & 0x7f) != 0) return -1;
  return (waitStatus >> 8) & 0xff;
}

bool IsFilesystemClean(const char* devicePath, FsType type) {
  if (!IsHfs(type)) return LogUncheckedKind(type, Level::Debug);
  Log(Level::Debug, "Checking the cleanlieness of the %s filesystem at %s.", FsTypeLabel(type), devicePath);
  return RunToolAndWait({kChecker, "-q", BoundedPath(devicePath)}) == 0;
}

int32_t RepairFilesystem(const char* devicePath, FsType type) {
  if (!IsHfs(type)) {
    LogUncheckedKind(type, Level::Default);
    return -1;
  }
  Log(Level::Debug, "Repairing the %s filesystem at %s.", FsTypeLabel(type), devicePath);
  return RunToolAndWait({kChecker, "-fy", BoundedPath(devicePath)});
}

}  // namespace brisvale
