// The "Mount" request for disk images: validation, the mount location, the
// already-mounted and identical-image rules, the verified mount, the image's jobs and
// the announcements.
#pragma once

#include "base/plist.h"
#include "daemon/matching_context.h"

namespace brisvale {

// Leaves "MountPath" and "Status" = "Success" in `reply` when the image is mounted (or
// an identical one already was); otherwise the reply keeps its preset "Failure".
void HandleDiskImageMount(MatchingContext& context, const plist::Value& request,
                          plist::Dictionary& reply);

}  // namespace brisvale
