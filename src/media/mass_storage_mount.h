// Mounting a removable mass-storage medium: HFS+ and HFSX volumes are checked, repaired
// when needed and mounted at the first free /var/mnt/mountN; FAT and exFAT volumes are
// only recorded so that clients can list them.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "base/plist.h"

namespace brisvale {

// Mounts the medium at `deviceNode` and returns its mount path, or none. On none,
// `verificationFailed` says the checker or the repair refused the volume and
// `mountFailed` says the mount itself (or choosing its mount point) failed; both stay
// false for a medium that is recorded without a mount or cannot be identified.
std::optional<std::string> MountMassStorageDevice(std::string_view deviceNode, bool readOnly,
                                                  bool& verificationFailed, bool& mountFailed);

// The "Mount" request for "DeviceType" "MassStorage": reads "DeviceNode" and
// "MountReadOnly", mounts, and stores "MountPath" and "Status" in `reply`.
void HandleMassStorageMount(const plist::Value& request, plist::Dictionary& reply);

}  // namespace brisvale
