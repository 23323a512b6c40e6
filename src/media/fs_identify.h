// File-system identification: which file system a removable medium holds, judged from
// the first 4096 bytes of its device node (boot-sector jump and OEM name, HFS+ volume
// header signature and version). The mass-storage mount, the attached-device listing and
// the check-and-repair step branch on the resulting code.
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <span>

#include "platform/os.h"

namespace brisvale {

// Stable codes: callers compare against the numbers.
enum FsType : uint32_t {
  FsTypeUnknown = 0,
  FsTypeFAT = 1,
  FsTypeHFSPlus = 2,
  FsTypeHFSX = 3,
  FsTypeExFAT = 4,
  FsTypeNTFS = 5,
};

// The label log lines print for a code: "Unknown", "MSDOS FAT", "HFS+", "HFSX",
// "MSDOS EXFAT", "MSDOS_NTFS". A code outside the table prints as "Unknown".
const char* FsTypeLabel(FsType type);

using os::kVolumeHeaderLength;
using os::VolumeHeaderRead;
using os::VolumeHeaderSpan;

// Opens `devicePath` read-only, fills `header` from offset 0 with one read call of
// kVolumeHeaderLength bytes, and closes the node on every path. Anything but a full
// read is ReadFailed. The daemon passes its os::Os; tests pass their own.
using VolumeHeaderReader = std::function<VolumeHeaderRead(const char* devicePath, VolumeHeaderSpan header)>;

// The code for a complete volume header; never fails.
FsType ClassifyVolumeHeader(std::span<const uint8_t, kVolumeHeaderLength> header);

// Reads `devicePath`'s volume header through `readHeader` and classifies it. An open or
// read failure is logged and yields FsTypeUnknown.
FsType IdentifyFilesystem(const char* devicePath, const VolumeHeaderReader& readHeader);

}  // namespace brisvale
