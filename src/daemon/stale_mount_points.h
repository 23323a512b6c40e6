// Start-up clean-up: empties a mount root of everything that is not a live mount,
// so a restart after a crash finds no stale mount points.
#pragma once

namespace brisvale {

void RemoveStaleMountPoints(const char* mountRoot);

}  // namespace brisvale
