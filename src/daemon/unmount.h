// Taking a mounted file system away ("Unmount") and the best-effort eject that the
// disk-image mount also uses on its failure paths.
#pragma once

namespace brisvale {

// Asks the device to go (a loop device lets go of its image, a removable disk is
// ejected). Failures are only logged.
void EjectDevice(const char* deviceNode);

}  // namespace brisvale
