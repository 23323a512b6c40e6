// Handlers whose subsystems are not built yet. A request routed here keeps the
// dispatcher's preset "Failure"; a hardware event routed here is only logged by the
// event handler.
#include "daemon/request_handlers.h"

namespace brisvale {

void SubscribeMediaAttach(MatchingContext&) {}
void SubscribeCameraAttach(MatchingContext&) {}
void HandleMediaDetached() {}

}  // namespace brisvale
