// The registry subscriptions a hardware event starts. Each event subscribes afresh to
// first matches of its kind of object, replacing the previous subscription of that
// kind only once the new one exists; the handler drains the objects that match already
// at once, and later ones arrive through the context's notification port.
#pragma once

#include "daemon/matching_context.h"

namespace brisvale {

// For "com.vantrel.brisvale_mounter.attached": every "KxMedia" object, to
// HandleMediaAttached.
void SubscribeMediaAttach(MatchingContext& context);
// For "com.vantrel.mobile.ptp_camera": still-image USB interfaces, to
// HandleCameraAttached.
void SubscribeCameraAttach(MatchingContext& context);

}  // namespace brisvale
