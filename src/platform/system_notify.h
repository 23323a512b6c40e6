// System-wide notifications: named events the daemon announces to whoever listens
// (mounts, unmounts, cameras). Posting never blocks and never fails the caller; a
// listener that is gone or too slow simply misses the notification.
#pragma once

#include <optional>
#include <string>

#include "base/plist.h"

namespace brisvale::notify {

struct Notification {
  std::string name;
  plist::Value object;                   // the platform passes the name itself here
  std::optional<plist::Dictionary> userInfo;
  bool distributed = false;              // also announced beyond this device's session
};

class SystemNotify {
 public:
  virtual ~SystemNotify() = default;
  virtual void Post(const Notification& notification) = 0;
};

// The common case: `name` as its own object, no user information, delivered at once.
inline Notification Named(std::string name) {
  plist::Value object(name);
  return Notification{std::move(name), std::move(object), std::nullopt, false};
}

}  // namespace brisvale::notify
