#include "platform/linux/os_volume_header.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>

namespace brisvale::os {
namespace {

class Descriptor {
 public:
  explicit Descriptor(int fd) : fd_(fd) {}
  ~Descriptor() {
    if (fd_ >= 0) {
      const int saved = errno;
      ::close(fd_);
      errno = saved;
    }
  }
  Descriptor(const Descriptor&) = delete;
  Descriptor& operator=(const Descriptor&) = delete;
  int get() const { return fd_; }

 private:
  int fd_;
};

}  // namespace

VolumeHeaderRead ReadVolumeHeader(const char* devicePath, VolumeHeaderSpan header) {
  const Descriptor fd(::open(devicePath, O_RDONLY));
  if (fd.get() < 0) return {VolumeHeaderRead::Outcome::OpenFailed, errno};
  // One call and no retry: a short read means the node is not a whole medium. A short
  // read sets no error number, so clear it to report 0 rather than a stale one.
  errno = 0;
  const ssize_t count = ::pread(fd.get(), header.data(), header.size(), 0);
  if (count != static_cast<ssize_t>(header.size())) return {VolumeHeaderRead::Outcome::ReadFailed, errno};
  return {VolumeHeaderRead::Outcome::Read, 0};
}

}  // namespace brisvale::os
