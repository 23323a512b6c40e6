// Mounting a checked HFS+/HFSX volume with "/sbin/mount_hfs" at the first free
// numbered mount point /var/mnt/mount1 .. /var/mnt/mount4.
#pragma once

#include <string>

#include "media/fs_identify.h"

namespace brisvale {

// A mount point is free when nothing exists at its path: an empty directory left by a
// failed mount keeps its number taken until an unmount or the start-up clean-up
// removes it. On success `mountPath` holds the mount point; 0, or -1 after a log line.
// The directory made is left in place when the tool then fails.
int MountHFSDevice(const char* devicePath, std::string& mountPath, FsType type, bool readOnly);

}  // namespace brisvale
