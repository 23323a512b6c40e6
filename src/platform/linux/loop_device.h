// The one way this project attaches a file to a loop device: from a descriptor the
// caller has already opened (and checked), so the device holds exactly that file.
#pragma once

#include <sys/types.h>

#include <string>

namespace brisvale::loop {

struct AttachOptions {
  bool readOnly = true;
  bool partitionScan = false;
  // The kernel detaches the device by itself once its last user (a mount, an open
  // descriptor) has gone.
  bool autoclear = false;
  // Stored in the device's file name field (at most 63 bytes kept), where a later
  // process finds it again.
  std::string identifier;
  // Where the device nodes live ("/dev" inside the daemon's root). A node missing
  // there is made for the attach and removed again.
  std::string deviceRoot = "/dev";
  // Skip LOOP_CONFIGURE and use the older two-step attach (what older kernels force).
  bool legacyAttach = false;
};

// An attached loop device, detached when its owner goes unless released first.
class LoopDevice {
 public:
  LoopDevice() = default;
  LoopDevice(LoopDevice&& other) noexcept;
  LoopDevice& operator=(LoopDevice&& other) noexcept;
  LoopDevice(const LoopDevice&) = delete;
  LoopDevice& operator=(const LoopDevice&) = delete;
  ~LoopDevice();

  explicit operator bool() const { return fd_ >= 0; }
  int number() const { return number_; }
  std::string name() const { return "loop" + std::to_string(number_); }  // "loop3"
  dev_t deviceNumber() const { return deviceNumber_; }
  // A descriptor for the device, valid while this owner holds it.
  int fd() const { return fd_; }

  // Detaches now: 0 or -errno.
  int Detach();
  // Leaves the device attached and lets go of it.
  void Release();

 private:
  friend int Attach(int fileFd, const AttachOptions& options, LoopDevice& device);
  int fd_ = -1;
  int number_ = -1;
  dev_t deviceNumber_ = 0;
};

// Attaches the file open on `fileFd` to a free loop device: 0 with `device` holding
// it, or -errno with nothing left attached.
int Attach(int fileFd, const AttachOptions& options, LoopDevice& device);

// The identifier stored in the file name field of the loop device open on `fd`.
int ReadIdentifier(int fd, std::string& identifier);

}  // namespace brisvale::loop
