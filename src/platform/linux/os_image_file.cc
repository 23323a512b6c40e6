// Files and directories of the disk-image mount: status, directory creation and the
// read lease that keeps a verified image from changing underneath the daemon.
#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <mutex>

#include "platform/linux/os_system.h"

namespace brisvale::os {
namespace {

FileStatus ToStatus(const struct stat& st) {
  return FileStatus{st.st_mode, st.st_dev, st.st_ino, st.st_nlink};
}

// A lease break is announced to its holder with SIGIO, whose default action ends the
// process. The daemon asks whether its lease still holds instead of waiting for the
// signal, so it is ignored unless someone installed a handler.
void IgnoreLeaseBreakSignal() {
  static std::once_flag once;
  std::call_once(once, [] {
    struct sigaction current {};
    if (sigaction(SIGIO, nullptr, &current) == 0 && current.sa_handler == SIG_DFL) {
      struct sigaction ignore {};
      ignore.sa_handler = SIG_IGN;
      sigaction(SIGIO, &ignore, nullptr);
    }
  });
}

}  // namespace

int LinuxOs::StatPath(const char* path, FileStatus& status) {
  struct stat st {};
  if (lstat(path, &st) < 0) return -errno;
  status = ToStatus(st);
  return 0;
}

int LinuxOs::StatDescriptor(int fd, FileStatus& status) {
  struct stat st {};
  if (fstat(fd, &st) < 0) return -errno;
  status = ToStatus(st);
  return 0;
}

int LinuxOs::MakeDirectory(const char* path, uint32_t mode) {
  return mkdir(path, mode) < 0 ? -errno : 0;
}

int LinuxOs::MakeTemporaryDirectory(std::string& pathTemplate) {
  return mkdtemp(pathTemplate.data()) ? 0 : -errno;
}

int LinuxOs::ChangeMode(const char* path, uint32_t mode) {
  return chmod(path, mode) < 0 ? -errno : 0;
}

int LinuxOs::OpenImageFile(const char* path) {
  // O_NONBLOCK keeps a FIFO from holding the open; the caller checks the file type.
  const int fd = open(path, O_RDONLY | O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK | O_NOCTTY);
  return fd < 0 ? -errno : fd;
}

int LinuxOs::TakeReadLease(int fd) {
  IgnoreLeaseBreakSignal();
  return fcntl(fd, F_SETLEASE, F_RDLCK) < 0 ? -errno : 0;
}

bool LinuxOs::HoldsReadLease(int fd) {
  // While a break is pending the kernel already answers the type the lease is being
  // broken to, so a writer waiting on the lease counts as broken.
  return fcntl(fd, F_GETLEASE) == F_RDLCK;
}

}  // namespace brisvale::os
