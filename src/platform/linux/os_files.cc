// Plain file reads for the core: whole small files, descriptors, sizes and read-only
// mappings, and the user database's home directories.
#include <fcntl.h>
#include <pwd.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "base/unique_fd.h"
#include "platform/linux/os_system.h"

namespace brisvale::os {
namespace {

class MemoryMapping final : public FileMapping {
 public:
  MemoryMapping(void* address, size_t length) : address_(address), length_(length) {}
  ~MemoryMapping() override { ::munmap(address_, length_); }
  MemoryMapping(const MemoryMapping&) = delete;
  MemoryMapping& operator=(const MemoryMapping&) = delete;
  std::span<const uint8_t> Bytes() const override {
    return {static_cast<const uint8_t*>(address_), length_};
  }

 private:
  void* address_;
  size_t length_;
};

}  // namespace

int LinuxOs::UserHomeDirectory(uint32_t uid, std::string& home) {
  std::vector<char> buffer(4096);
  struct passwd entry {};
  struct passwd* found = nullptr;
  const int rc = ::getpwuid_r(uid, &entry, buffer.data(), buffer.size(), &found);
  if (rc != 0) return -rc;
  if (!found || !found->pw_dir) return -ENOENT;
  home = found->pw_dir;
  return 0;
}

int LinuxOs::ReadFile(const char* path, size_t maxLength, std::vector<uint8_t>& contents) {
  contents.clear();
  const UniqueFd fd(::open(path, O_RDONLY | O_CLOEXEC));
  if (!fd) return -errno;
  contents.resize(maxLength);
  size_t filled = 0;
  while (filled < maxLength) {
    const ssize_t count = ::read(fd.get(), contents.data() + filled, maxLength - filled);
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) {
      contents.clear();
      return -errno;
    }
    if (count == 0) break;
    filled += static_cast<size_t>(count);
  }
  contents.resize(filled);
  return 0;
}

int LinuxOs::OpenFile(const char* path) {
  const int fd = ::open(path, O_RDONLY | O_CLOEXEC);
  if (fd < 0) return -errno;
  // Only a hint for the read-ahead: a refusal changes nothing.
  ::posix_fadvise(fd, 0, 0, POSIX_FADV_SEQUENTIAL);
  return fd;
}

int64_t LinuxOs::Read(int fd, std::span<uint8_t> buffer, uint64_t offset) {
  for (;;) {
    const ssize_t count = ::pread(fd, buffer.data(), buffer.size(), static_cast<off_t>(offset));
    if (count >= 0) return count;
    if (errno != EINTR) return -errno;
  }
}

int LinuxOs::FileSize(int fd, uint64_t& size) {
  struct stat status {};
  if (::fstat(fd, &status) != 0) return -errno;
  size = static_cast<uint64_t>(status.st_size);
  return 0;
}

int LinuxOs::MapFile(int fd, size_t length, std::unique_ptr<FileMapping>& mapping) {
  // Linux has no MAP_NOCACHE: the pages stay in the page cache like any read. The
  // mapping is private so that nothing the file's owner writes later can reach bytes
  // already handed on (a private mapping of a read-only descriptor is never written).
  void* address = ::mmap(nullptr, length, PROT_READ, MAP_PRIVATE, fd, 0);
  if (address == MAP_FAILED) return -errno;
  mapping = std::make_unique<MemoryMapping>(address, length);
  return 0;
}

}  // namespace brisvale::os
