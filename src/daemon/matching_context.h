// The process-wide matching state: the registry notification port through which
// first-match notifications arrive, and the current media and camera subscriptions.
// One instance lives for the whole process and is shared by reference.
#pragma once

#include <cstdint>

namespace brisvale {

struct MatchingContext {
  uint32_t notificationPort = 0;
  uint32_t mediaIterator = 0;   // 0 = no media subscription yet
  uint32_t cameraIterator = 0;  // 0 = no camera subscription yet
};

}  // namespace brisvale
