#include "platform/linux/ipc_uevent.h"

#include <string_view>

namespace brisvale::ipc {

std::optional<std::string> MatchingEventForUevent(std::span<const uint8_t> datagram) {
  const std::string_view text(reinterpret_cast<const char*>(datagram.data()), datagram.size());
  std::string_view action, subsystem, devtype, interface;
  bool sawHeader = false;
  size_t pos = 0;
  while (pos < text.size()) {
    size_t end = text.find('\0', pos);
    if (end == std::string_view::npos) end = text.size();
    const std::string_view field = text.substr(pos, end - pos);
    pos = end + 1;
    if (!sawHeader) {
      // The kernel's datagrams open with "ACTION@DEVPATH"; anything else (such as the
      // udev daemon's re-broadcasts) is not a kernel event.
      if (field.find('@') == std::string_view::npos) return std::nullopt;
      sawHeader = true;
      continue;
    }
    const size_t equals = field.find('=');
    if (equals == std::string_view::npos) continue;
    const std::string_view key = field.substr(0, equals);
    const std::string_view value = field.substr(equals + 1);
    if (key == "ACTION") {
      action = value;
    } else if (key == "SUBSYSTEM") {
      subsystem = value;
    } else if (key == "DEVTYPE") {
      devtype = value;
    } else if (key == "INTERFACE") {
      interface = value;
    }
  }

  if (subsystem == "block") {
    if (action == "add" || action == "change") return std::string(kMediaAttachedEvent);
    if (action == "remove") return std::string(kMediaDetachedEvent);
    return std::nullopt;
  }
  if (subsystem == "usb" && devtype == "usb_interface" && action == "add" && interface == "6/1/1") {
    return std::string(kCameraEvent);
  }
  return std::nullopt;
}

}  // namespace brisvale::ipc
