// The Linux implementation of the core's operating-system interface. Each group of
// calls is implemented in its own os_*.cc file.
#pragma once

#include <span>

#include "platform/os.h"

namespace brisvale::os {

class LinuxOs final : public Os {
 public:
  int GetMountTable(std::span<MountRecord> records) override;
};

// GetMountTable over a table in the kernel's mountinfo format at `path`.
int ReadMountTable(const char* path, std::span<MountRecord> records);

}  // namespace brisvale::os
