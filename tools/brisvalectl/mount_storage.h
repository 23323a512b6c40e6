// `brisvalectl mount-storage NODE [--read-only]`: asks the daemon to check and mount an
// attached removable medium by its device node; prints the mount path.
#pragma once

#include <string>
#include <vector>

#include "mount_image.h"

namespace brisvale::tools {

// `arguments` follow "mount-storage": the node and optionally --read-only.
int MountStorage(const std::vector<std::string>& arguments, bool json, const RequestSender& send);

}  // namespace brisvale::tools
