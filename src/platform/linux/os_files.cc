// Plain file reads for the core: image digests and certificate files.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "platform/linux/os_system.h"

namespace brisvale::os {

int LinuxOs::OpenFile(const char* path) {
  const int fd = ::open(path, O_RDONLY | O_CLOEXEC);
  if (fd < 0) return -errno;
  // Only a hint for the read-ahead: a refusal changes nothing.
  ::posix_fadvise(fd, 0, 0, POSIX_FADV_SEQUENTIAL);
  return fd;
}

int64_t LinuxOs::FileSize(int fd) {
  struct stat status;
  if (::fstat(fd, &status) != 0) return -errno;
  return status.st_size;
}

int64_t LinuxOs::Read(int fd, std::span<uint8_t> buffer) {
  for (;;) {
    const ssize_t count = ::read(fd, buffer.data(), buffer.size());
    if (count >= 0) return count;
    if (errno != EINTR) return -errno;
  }
}

}  // namespace brisvale::os
