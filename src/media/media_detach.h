// The answer to "media may have gone": every mass-storage file system whose device is
// no longer attached is force-unmounted and its mount point removed, so a stick pulled
// out without an eject leaves neither a dead mount nor a stale directory. Disk images
// are never touched here. "com.vantrel.brisvale_unmounted" is posted in every case so
// that clients read the device list again.
#pragma once

#include "base/plist.h"

namespace brisvale {

void HandleMediaDetached();

// The unmount half over a given map of mounted file systems keyed by device node.
void UnmountPulledMedia(const plist::Dictionary& mounted);

}  // namespace brisvale
