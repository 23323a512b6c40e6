// Checking and repairing a removable volume with the external checker "/sbin/fsck_hfs"
// before it is mounted, so a stick pulled out without an unmount is never mounted in an
// inconsistent state. FAT and exFAT volumes are never checked.
//
// HFSX is checked and repaired exactly as HFS+: the same checker handles both, and
// Linux's hfsplus driver mounts both.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "media/fs_identify.h"

namespace brisvale {

// Starts argv[0] (an absolute path) with `argv`, no environment, and waits for it with
// no time limit. The tool's exit status (0-255), or -1 when it could not be started or
// waited for or ended by a signal.
int32_t RunToolAndWait(const std::vector<std::string>& argv);

// False only when the quick check of an HFS+/HFSX volume answered anything but 0 (a
// checker that did not run included); true for every kind that is not checked.
bool IsFilesystemClean(const char* devicePath, FsType type);

// The forced check-and-repair's result for HFS+/HFSX (0 means consistent now, a
// positive value is the checker's own failure status); -1 for every other kind.
int32_t RepairFilesystem(const char* devicePath, FsType type);

}  // namespace brisvale
