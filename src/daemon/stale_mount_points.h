// Start-up clean-up: empties a mount root of everything that is not a live mount, so a
// restart after a crash finds no stale mount points.
#pragma once

namespace brisvale {

void RemoveStaleMountPoints(const char* mountRoot);

// Removes everything below `path` and, when `removeStart` is non-zero, `path` itself;
// never follows a link below the start and never enters another file system. 0 or -1.
int RemoveTree(const char* path, int removeStart);

}  // namespace brisvale
