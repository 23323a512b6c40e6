// The first-match handler of the media subscription: decides for each registry medium
// whether it is removable user media to mount, mounts it (read-only unless it says it
// is writable) and tells the user through an alert when that fails.
#pragma once

#include <functional>
#include <optional>
#include <string>
#include <string_view>

#include "daemon/matching_context.h"
#include "platform/device_registry.h"

namespace brisvale {

void HandleMediaAttached(MatchingContext& context, registry::Iterator& iterator);

// The two things the handler does to the outside world, replaceable so the filters can
// be exercised without tools or an alert agent.
using MediaMountFunction = std::function<std::optional<std::string>(
    std::string_view deviceNode, bool readOnly, bool& verificationFailed, bool& mountFailed)>;
using MediaAlertFunction = std::function<void(const char* titleKey, const char* bodyKey,
                                              const char* buttonKey, registry::ObjectRef media)>;
void InspectAttachedMedia(registry::Iterator& iterator, const MediaMountFunction& mount,
                          const MediaAlertFunction& alert);

}  // namespace brisvale
