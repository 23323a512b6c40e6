// The device read behind file-system identification: one open, one read of the volume
// header from offset 0, one close, with plain POSIX calls.
#pragma once

#include "media/fs_identify.h"

namespace brisvale::os {

// A VolumeHeaderReader for real device nodes (and plain files standing in for them).
VolumeHeaderRead ReadVolumeHeader(const char* devicePath, VolumeHeaderSpan header);

}  // namespace brisvale::os
