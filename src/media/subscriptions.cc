#include "media/subscriptions.h"

#include "base/log.h"
#include "media/cameras.h"
#include "media/keep_alive.h"
#include "media/media_attach.h"
#include "platform/services.h"

namespace brisvale {
namespace {

using AttachHandler = void (*)(MatchingContext&, registry::Iterator&);

void Subscribe(MatchingContext& context, const registry::Matching& matching,
               std::unique_ptr<registry::Iterator> MatchingContext::*current,
               AttachHandler handler) {
  KeepAliveFor(context.backgroundQueue, context.keepAlive);

  registry::Result<std::unique_ptr<registry::Iterator>> added{registry::kError, nullptr};
  if (context.notificationPort) {
    added = CurrentServices().registry->AddMatchingNotification(
        *context.notificationPort, registry::MatchKind::FirstMatch, matching,
        [&context, handler](registry::Iterator& iterator) { handler(context, iterator); });
  }
  if (!added.ok() || !added.value) {
    const registry::Status status = added.ok() ? registry::kError : added.status;
    Log(Level::Default, "KxServiceAddMatchingNotification failed: %04x", status & 0x3FFF);
    return;  // the earlier subscription stays live
  }
  // Dropping the old iterator first ends its notification before the new one is kept.
  (context.*current).reset();
  context.*current = std::move(added.value);
  handler(context, *(context.*current));
}

}  // namespace

// A matching description here is a plain value, so building one cannot fail.
void SubscribeMediaAttach(MatchingContext& context) {
  Subscribe(context, registry::Matching::Class("KxMedia"), &MatchingContext::mediaIterator,
            &HandleMediaAttached);
}

void SubscribeCameraAttach(MatchingContext& context) {
  Subscribe(context, StillImageInterfaceMatching(), &MatchingContext::cameraIterator,
            &HandleCameraAttached);
}

}  // namespace brisvale
