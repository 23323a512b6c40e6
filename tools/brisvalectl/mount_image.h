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

// Prints a "Mount" reply: its mount path (or the whole reply with `json`), or the
// failure on stderr. 0 for "Success", 1 otherwise.
int PrintMountReply(const plist::Value& reply, bool json);

// `arguments` follow "mount-image": --type T, --signature FILE, --consume, IMAGE.
int MountImage(const std::vector<std::string>& arguments, const std::string& root, bool json,
               const RequestSender& send);

}  // namespace brisvale::tools
