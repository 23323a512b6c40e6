// A real file system for integration tests: an ext4 image built without root, attached
// to a loop device and mounted, all released in the destructor, also when a test fails;
// and what the kernel has mounted where.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "platform/linux/loop_device.h"

namespace brisvale::testing {

// Builds a `sizeMiB` ext4 image at `imagePath` (holding a copy of `contentDir` when not
// empty). false with a message in `error` when mkfs fails.
bool MakeExt4Image(const std::string& imagePath, int sizeMiB, const std::string& contentDir,
                   std::string* error);

// What the kernel has mounted at or below `dir`, one entry a mount (stacked mounts
// count twice).
std::vector<std::string> MountPointsBelow(const std::string& dir);

class LoopMount {
 public:
  // Attaches `imagePath` to a free loop device (read-only when asked), creates the
  // device node under `devRoot` when it lacks one, and mounts the device at
  // `mountPoint`, which must exist. nullptr with a message in `error` on failure.
  static std::unique_ptr<LoopMount> Create(const std::string& imagePath, const std::string& mountPoint,
                                           const std::string& devRoot, bool readOnly,
                                           std::string* error);
  ~LoopMount();  // not copyable: the loop device has one owner

  // "/dev/loopN", as the mount table and the daemon name it.
  const std::string& device() const { return device_; }

 private:
  LoopMount() = default;
  std::string device_;
  std::string mountPoint_;
  std::string nodeCreated_;  // the node made under the device root, removed again
  loop::LoopDevice loop_;
};

}  // namespace brisvale::testing
