// The process-wide matching state: the registry notification port through which
// first-match notifications arrive, and the current media and camera subscriptions.
// One instance lives for the whole process and is shared by reference.
#pragma once

#include <chrono>
#include <memory>

#include "platform/device_registry.h"

namespace brisvale {

class BackgroundQueue;

struct MatchingContext {
  std::unique_ptr<registry::NotificationPort> notificationPort;
  std::unique_ptr<registry::Iterator> mediaIterator;   // none until media are subscribed
  std::unique_ptr<registry::Iterator> cameraIterator;  // none until cameras are subscribed
  // Ends the keep-alive transaction each subscription opens, `keepAlive` after it.
  BackgroundQueue* backgroundQueue = nullptr;
  std::chrono::milliseconds keepAlive{15000};
};

}  // namespace brisvale
