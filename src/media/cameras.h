// Still-image (PTP) cameras: the daemon never mounts them, it announces each one that
// appears and lists the last one found as a single device-list entry under "PTPNode".
#pragma once

#include <optional>

#include "base/plist.h"
#include "daemon/matching_context.h"
#include "platform/device_registry.h"

namespace brisvale {

// USB interfaces of class 6, subclass 1, protocol 1: the still-image interface that
// carries PTP.
registry::Matching StillImageInterfaceMatching();

// Posts "com.vantrel.mobile.camera_attached" with the camera's record for every object
// `iterator` yields.
void HandleCameraAttached(MatchingContext& context, registry::Iterator& iterator);

// The camera list: empty when no camera is attached, and at most one entry, under
// "PTPNode", however many there are.
std::optional<plist::Dictionary> CopyCameraEntries();

}  // namespace brisvale
