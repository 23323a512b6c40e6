#include "daemon/stale_mount_points.h"

namespace brisvale {

// The tree removal arrives with the unmount work; until then start-up leaves the
// roots as they are.
void RemoveStaleMountPoints(const char*) {}

}  // namespace brisvale
