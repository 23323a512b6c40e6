#include "platform/linux/loop_device.h"

#include <fcntl.h>
#include <linux/loop.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <utility>

#include "base/unique_fd.h"
#include "platform/linux/os_system.h"

namespace brisvale::loop {
namespace {

constexpr unsigned kLoopMajor = 7;
// A free device can be taken by another process between asking for it and configuring
// it; the kernel then answers EBUSY and another free one is asked for.
constexpr int kAttachAttempts = 16;

int Errno() { return errno ? -errno : -EIO; }

// The device number sysfs gives the loop device: its minor depends on how many
// partitions the driver reserves per device.
dev_t LoopDeviceNumber(int number) {
  const dev_t device = os::ReadDeviceNumberFile("/sys/block/loop" + std::to_string(number) + "/dev");
  return device != 0 ? device : makedev(kLoopMajor, static_cast<unsigned>(number));
}

// Opens loop device `number` through the device root, making its node for the open
// when the root lacks one. The node goes again at once: the registry provider keeps the
// device root's nodes, and removes the ones it made when the device leaves.
int OpenLoop(const std::string& deviceRoot, int number, dev_t& deviceNumber) {
  deviceNumber = LoopDeviceNumber(number);
  const std::string node = deviceRoot + "/loop" + std::to_string(number);
  int fd = ::open(node.c_str(), O_RDWR | O_CLOEXEC | O_NOFOLLOW);
  if (fd >= 0 || errno != ENOENT) return fd >= 0 ? fd : -errno;
  if (::mknod(node.c_str(), S_IFBLK | 0600, deviceNumber) != 0) return Errno();
  fd = ::open(node.c_str(), O_RDWR | O_CLOEXEC | O_NOFOLLOW);
  const int openError = errno;
  ::unlink(node.c_str());
  return fd >= 0 ? fd : -openError;
}

void FillInfo(loop_info64& info, const AttachOptions& options) {
  info.lo_flags = (options.readOnly ? LO_FLAGS_READ_ONLY : 0) |
                  (options.partitionScan ? LO_FLAGS_PARTSCAN : 0) |
                  (options.autoclear ? LO_FLAGS_AUTOCLEAR : 0);
  std::strncpy(reinterpret_cast<char*>(info.lo_file_name), options.identifier.c_str(),
               LO_NAME_SIZE - 1);
}

// LOOP_CONFIGURE: one call that attaches and sets the flags and name.
int Configure(int loopFd, int fileFd, const AttachOptions& options) {
  loop_config config{};
  config.fd = static_cast<uint32_t>(fileFd);
  FillInfo(config.info, options);
  return ::ioctl(loopFd, LOOP_CONFIGURE, &config) == 0 ? 0 : Errno();
}

// The older way: attach, then set the flags and the name. Read-only comes from the
// file's open mode here (the flag cannot be set afterwards), so a read-only attach
// needs a read-only descriptor.
int SetFdAndStatus(int loopFd, int fileFd, const AttachOptions& options) {
  if (options.readOnly && (::fcntl(fileFd, F_GETFL) & O_ACCMODE) != O_RDONLY) return -EINVAL;
  if (::ioctl(loopFd, LOOP_SET_FD, fileFd) != 0) return Errno();
  loop_info64 info{};
  FillInfo(info, options);
  info.lo_flags &= ~LO_FLAGS_READ_ONLY;
  if (::ioctl(loopFd, LOOP_SET_STATUS64, &info) != 0) {
    const int error = Errno();
    ::ioctl(loopFd, LOOP_CLR_FD);
    return error;
  }
  return 0;
}

}  // namespace

LoopDevice::LoopDevice(LoopDevice&& other) noexcept
    : fd_(std::exchange(other.fd_, -1)),
      number_(std::exchange(other.number_, -1)),
      deviceNumber_(std::exchange(other.deviceNumber_, 0)) {}

LoopDevice& LoopDevice::operator=(LoopDevice&& other) noexcept {
  if (this != &other) {
    Detach();
    fd_ = std::exchange(other.fd_, -1);
    number_ = std::exchange(other.number_, -1);
    deviceNumber_ = std::exchange(other.deviceNumber_, 0);
  }
  return *this;
}

LoopDevice::~LoopDevice() { Detach(); }

int LoopDevice::Detach() {
  if (fd_ < 0) return 0;
  const int rc = ::ioctl(fd_, LOOP_CLR_FD) == 0 ? 0 : Errno();
  ::close(std::exchange(fd_, -1));
  return rc;
}

void LoopDevice::Release() {
  if (fd_ >= 0) ::close(std::exchange(fd_, -1));
}

int Attach(int fileFd, const AttachOptions& options, LoopDevice& device) {
  const UniqueFd control(::open((options.deviceRoot + "/loop-control").c_str(), O_RDWR | O_CLOEXEC));
  if (!control) return Errno();
  bool legacy = options.legacyAttach;
  int error = -EBUSY;
  for (int attempt = 0; attempt < kAttachAttempts && error == -EBUSY; ++attempt) {
    const int number = ::ioctl(control.get(), LOOP_CTL_GET_FREE);
    if (number < 0) return Errno();
    dev_t deviceNumber = 0;
    const int opened = OpenLoop(options.deviceRoot, number, deviceNumber);
    if (opened < 0) return opened;
    UniqueFd loopFd(opened);
    if (!legacy) {
      error = Configure(loopFd.get(), fileFd, options);
      // A kernel without LOOP_CONFIGURE answers one of these two.
      legacy = error == -EINVAL || error == -ENOTTY;
    }
    if (legacy) error = SetFdAndStatus(loopFd.get(), fileFd, options);
    if (error == 0) {
      device = LoopDevice();
      device.fd_ = loopFd.release();
      device.number_ = number;
      device.deviceNumber_ = deviceNumber;
    }
  }
  return error;
}

int ReadIdentifier(int fd, std::string& identifier) {
  loop_info64 info{};
  if (::ioctl(fd, LOOP_GET_STATUS64, &info) != 0) return Errno();
  const char* name = reinterpret_cast<const char*>(info.lo_file_name);
  identifier.assign(name, strnlen(name, sizeof info.lo_file_name));
  return 0;
}

}  // namespace brisvale::loop
