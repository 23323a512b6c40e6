// The operating system's calls the daemon's core makes, behind one interface so the
// core can be tested with a fake. Each group of calls is added here as the code that
// needs it is written; the Linux implementation lives in platform/linux/os_*.
#pragma once

#include <cstdint>
#include <span>
#include <string>

namespace brisvale::os {

// Mount-table flags.
inline constexpr uint32_t kMountReadOnly = 0x1;
inline constexpr uint32_t kMountContentProtection = 0x80;  // never set on Linux

// One mounted file system.
struct MountRecord {
  uint32_t flags = 0;
  std::string typeName;     // "ext4", "tmpfs", "hfs" ...
  std::string mountedOn;    // the directory, escapes of the kernel's table decoded
  std::string mountedFrom;  // the source: a device path, or a name such as "tmpfs"
  bool operator==(const MountRecord&) const = default;
};

class Os {
 public:
  virtual ~Os() = default;

  // The mount table, in table order, count first then fill: with no room it answers
  // how many file systems are mounted; with room it fills at most records.size()
  // records and answers how many it filled. -errno on failure.
  virtual int GetMountTable(std::span<MountRecord> records) = 0;
};

// The operating system this process runs on.
Os& SystemOs();

}  // namespace brisvale::os
