// Kernel device events translated into the hardware event stream's event names.
#include "platform/linux/ipc_uevent.h"

#include <gtest/gtest.h>

#include <string>

namespace brisvale::ipc {
namespace {

using namespace std::string_literals;

// A kernel datagram: "ACTION@DEVPATH" then KEY=VALUE fields, each NUL-terminated.
std::string Uevent(std::initializer_list<std::string> fields) {
  std::string datagram;
  for (const std::string& field : fields) {
    datagram += field;
    datagram.push_back('\0');
  }
  return datagram;
}

std::optional<std::string> Translate(const std::string& datagram) {
  return MatchingEventForUevent(
      std::span<const uint8_t>(reinterpret_cast<const uint8_t*>(datagram.data()), datagram.size()));
}

TEST(KernelDeviceEventTest, TranslatesMediaAndCameraEventsOnly) {
  const std::string usbInterface = "/devices/pci0000:00/0000:00:14.0/usb1/1-2/1-2:1.0";
  struct Case {
    const char* name;
    std::string datagram;
    std::optional<std::string> event;
  };
  const Case cases[] = {
      {"disk added", Uevent({"add@/devices/virtual/block/loop0", "ACTION=add", "SUBSYSTEM=block", "DEVTYPE=disk"}),
       kMediaAttachedEvent},
      {"medium changed", Uevent({"change@/block/sdb", "ACTION=change", "SUBSYSTEM=block"}), kMediaAttachedEvent},
      {"partition removed", Uevent({"remove@/block/sdb/sdb1", "ACTION=remove", "SUBSYSTEM=block"}),
       kMediaDetachedEvent},
      {"block bind is nothing", Uevent({"bind@/block/sdb", "ACTION=bind", "SUBSYSTEM=block"}), std::nullopt},
      {"still-image interface added",
       Uevent({"add@" + usbInterface, "ACTION=add", "SUBSYSTEM=usb", "DEVTYPE=usb_interface", "INTERFACE=6/1/1"}),
       kCameraEvent},
      {"still-image interface removed",
       Uevent({"remove@" + usbInterface, "ACTION=remove", "SUBSYSTEM=usb", "DEVTYPE=usb_interface",
               "INTERFACE=6/1/1"}),
       std::nullopt},
      {"mass-storage interface",
       Uevent({"add@" + usbInterface, "ACTION=add", "SUBSYSTEM=usb", "DEVTYPE=usb_interface", "INTERFACE=8/6/80"}),
       std::nullopt},
      {"usb device with a camera-like product", Uevent({"add@/usb1/1-2", "ACTION=add", "SUBSYSTEM=usb",
                                                        "DEVTYPE=usb_device", "INTERFACE=6/1/1"}),
       std::nullopt},
      {"udev re-broadcast", Uevent({"libudev", "ACTION=add", "SUBSYSTEM=block"}), std::nullopt},
      {"no terminator on the last field", "add@/block/sdc\0ACTION=add\0SUBSYSTEM=block"s, kMediaAttachedEvent},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    EXPECT_EQ(Translate(c.datagram), c.event);
  }
}

}  // namespace
}  // namespace brisvale::ipc
