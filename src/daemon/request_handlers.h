// The request and hardware-event handlers the dispatcher and the event stream route to.
// Each request handler reads the decoded request and leaves its outcome in the reply,
// whose "Status" the dispatcher has preset to "Failure".
#pragma once

#include "base/plist.h"
#include "daemon/matching_context.h"
#include "inventory/inventory.h"
#include "media/media_detach.h"
#include "media/subscriptions.h"

namespace brisvale {

void HandleMountRequest(MatchingContext& context, const plist::Value& request,
                        plist::Dictionary& reply);
void HandleUnmount(const plist::Value& request, plist::Dictionary& reply);
void HandleSync(const plist::Value& request, plist::Dictionary& reply);

}  // namespace brisvale
