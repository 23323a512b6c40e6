// Taking file systems and devices away: forced unmount, mount-point removal, volume
// flush and the best-effort eject.
#include <fcntl.h>
#include <linux/cdrom.h>
#include <linux/loop.h>
#include <sys/ioctl.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <cerrno>

#include "base/unique_fd.h"
#include "platform/linux/os_system.h"

namespace brisvale::os {
namespace {

constexpr unsigned kLoopMajor = 7;

int Status(int rc) { return rc == 0 ? 0 : -errno; }

}  // namespace

int LinuxOs::Unmount(const char* path, bool force) {
  if (::umount2(path, force ? MNT_FORCE : 0) == 0) return 0;
  // MNT_FORCE only aborts pending requests of network file systems; a local volume with
  // open files stays busy. Detaching takes it out of the tree at once, and the kernel
  // lets the file system go when the last open file is closed.
  if (force && errno == EBUSY) return Status(::umount2(path, MNT_DETACH));
  return -errno;
}

int LinuxOs::RemoveDirectory(const char* path) { return Status(::rmdir(path)); }

int LinuxOs::Unlink(const char* path) { return Status(::unlink(path)); }

int LinuxOs::SyncFilesystem(const char* path) {
  const UniqueFd fd(::open(path, O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!fd) return -errno;
  // syncfs returns once the file system's dirty data and metadata have been written
  // and the device has been asked to flush its cache.
  return Status(::syncfs(fd.get()));
}

int LinuxOs::OpenDevice(const char* devicePath) {
  const int fd = ::open(devicePath, O_RDONLY | O_NONBLOCK | O_CLOEXEC);
  return fd >= 0 ? fd : -errno;
}

int LinuxOs::EjectDevice(int fd) {
  struct stat status {};
  if (::fstat(fd, &status) != 0) return -errno;
  if (!S_ISBLK(status.st_mode)) return -ENOTBLK;
  if (major(status.st_rdev) == kLoopMajor) return Status(::ioctl(fd, LOOP_CLR_FD));
  // Ejecting one partition would take the whole disk, siblings and all.
  if (DiskHasMountedPartition(status.st_rdev)) return -EBUSY;
  return Status(::ioctl(fd, CDROMEJECT));
}

int LinuxOs::MountedDevice(const char* path, uint64_t& device) {
  struct statx status {};
  if (::statx(AT_FDCWD, path, AT_SYMLINK_NOFOLLOW, STATX_TYPE, &status) != 0) return -errno;
  // Memory and pseudo file systems get numbers of the unnamed major 0: no device
  // holds them, whatever the mount table names as their source.
  if (status.stx_dev_major == 0) return -ENODEV;
  device = makedev(status.stx_dev_major, status.stx_dev_minor);
  return 0;
}

int LinuxOs::DeviceNumber(int fd, uint64_t& device) {
  struct stat status {};
  if (::fstat(fd, &status) != 0) return -errno;
  if (!S_ISBLK(status.st_mode)) return -ENOTBLK;
  device = status.st_rdev;
  return 0;
}

}  // namespace brisvale::os
