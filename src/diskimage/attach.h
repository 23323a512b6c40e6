// Attaching an image file through the disk-image driver's controller and finding the
// media it publishes for it.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace brisvale {

// The file the daemon verified: the controller refuses to attach any other, and the
// attach stops when the file was opened for writing since it was verified.
struct VerifiedFile {
  int fd = -1;  // read-only, holding a read lease
  uint64_t device = 0;
  uint64_t inode = 0;
};

// Attaches `imagePath` and mounts its volume at `mountPath`. Answers the device node
// ("/dev/loop3"), or none after logging why.
std::optional<std::string> AttachAndMountImage(std::string_view imagePath, std::string_view mountPath,
                                               const VerifiedFile* verified = nullptr);

// Asks the controller to attach `imagePath`; answers the identifier it was attached
// under, a fresh UUID, or none after logging why.
std::optional<std::string> AttachDiskImage(std::string_view imagePath,
                                           const VerifiedFile* verified = nullptr);

// The BSD name of the media published for `uniqueIdentifier` (the last one when the
// image has several), or none.
std::optional<std::string> FindAttachedMedia(std::string_view uniqueIdentifier);

// A random (version 4) UUID in its canonical upper-case 8-4-4-4-12 text.
std::string CreateUuidString();

}  // namespace brisvale
