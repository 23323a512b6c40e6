// Kernel device events translated into the hardware event stream's event names.
#include "platform/linux/ipc_uevent.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace brisvale::ipc {
namespace {

using namespace std::string_literals;

// A kernel datagram: "ACTION@DEVPATH" then KEY=VALUE fields, each NUL-terminated.
std::string Uevent(const std::string& action, const std::string& subsystem, const std::string& more = "") {
  return action + "@/devices/x\0ACTION="s + action + "\0SUBSYSTEM="s + subsystem + '\0' + more;
}

TEST(KernelDeviceEventTest, TranslatesMediaAndCameraEventsOnly) {
  const std::string stillImage = "DEVTYPE=usb_interface\0INTERFACE=6/1/1\0"s;
  struct Case {
    const char* name;
    std::string datagram;
    std::optional<std::string> event;
  };
  const Case cases[] = {
      {"disk added", Uevent("add", "block", "DEVTYPE=disk\0"s), kMediaAttachedEvent},
      {"medium changed", Uevent("change", "block"), kMediaAttachedEvent},
      {"partition removed", Uevent("remove", "block"), kMediaDetachedEvent},
      {"block bind is nothing", Uevent("bind", "block"), std::nullopt},
      {"still-image interface added", Uevent("add", "usb", stillImage), kCameraEvent},
      {"still-image interface removed", Uevent("remove", "usb", stillImage), std::nullopt},
      {"mass-storage interface", Uevent("add", "usb", "DEVTYPE=usb_interface\0INTERFACE=8/6/80\0"s), std::nullopt},
      {"usb device with a camera-like product", Uevent("add", "usb", "DEVTYPE=usb_device\0INTERFACE=6/1/1\0"s),
       std::nullopt},
      {"udev re-broadcast", "libudev\0ACTION=add\0SUBSYSTEM=block\0"s, std::nullopt},
      {"no terminator on the last field", "add@/block/sdc\0ACTION=add\0SUBSYSTEM=block"s, kMediaAttachedEvent},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    EXPECT_EQ(MatchingEventForUevent(std::vector<uint8_t>(c.datagram.begin(), c.datagram.end())), c.event);
  }
}

}  // namespace
}  // namespace brisvale::ipc
