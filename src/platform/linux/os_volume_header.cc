// The device read behind file-system identification: one open, one read of the volume
// header from offset 0, one close, with plain POSIX calls.
#include <fcntl.h>
#include <unistd.h>

#include <cerrno>

#include "base/unique_fd.h"
#include "platform/linux/os_system.h"

namespace brisvale::os {

VolumeHeaderRead LinuxOs::ReadVolumeHeader(const char* devicePath, VolumeHeaderSpan header) {
  // A FIFO placed where a medium's node should be must not block the daemon's only
  // thread in open(); its read then fails like that of any other non-medium.
  const UniqueFd fd(::open(devicePath, O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
  if (!fd) return {VolumeHeaderRead::Outcome::OpenFailed, errno};
  // One call and no retry: a short read means the node is not a whole medium. A short
  // read sets no error number, so clear it to report 0 rather than a stale one.
  errno = 0;
  const ssize_t count = ::pread(fd.get(), header.data(), header.size(), 0);
  if (count != static_cast<ssize_t>(header.size())) return {VolumeHeaderRead::Outcome::ReadFailed, errno};
  return {VolumeHeaderRead::Outcome::Read, 0};
}

}  // namespace brisvale::os
