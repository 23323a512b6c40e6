// `brisvalectl mount-image`: hands a disk image and its signature or manifest to the
// daemon. The daemon consumes the file it is given, so by default a copy is staged
// inside the daemon's root and the caller keeps the original.
#pragma once

#include <functional>
#include <string>
#include <variant>
#include <vector>

#include "base/plist.h"

namespace brisvale::tools {

// Sends one request; answers the decoded reply or an exit status.
using RequestSender = std::function<std::variant<plist::Value, int>(const plist::Value& request)>;

// `arguments` follow "mount-image": --type T, --signature FILE, --consume, IMAGE.
int MountImage(const std::vector<std::string>& arguments, const std::string& root, bool json,
               const RequestSender& send);

}  // namespace brisvale::tools
