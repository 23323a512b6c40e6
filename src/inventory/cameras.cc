// The listing half of cameras: a still-image (PTP) USB interface appears in the device
// list as one entry under "PTPNode".
#include "base/log.h"
#include "inventory/inventory.h"
#include "platform/services.h"

namespace brisvale {

std::optional<DeviceMap> CopyCameraEntries() {
  DeviceMap cameras;
  registry::Matching matching = registry::Matching::Class("KxUSBHostInterface");
  matching.Set("bInterfaceClass", plist::Value::Int(6))
      .Set("bInterfaceSubClass", plist::Value::Int(1))
      .Set("bInterfaceProtocol", plist::Value::Int(1));
  auto found = CurrentServices().registry->GetMatchingServices(matching);
  if (!found.ok() || !found.value) return cameras;
  // Several cameras leave only the last one found: the list has one slot.
  while (const registry::ObjectRef camera = found.value->Next()) {
    const registry::Result<plist::Value> properties = camera->CopyProperties();
    if (!properties.ok()) {
      log::Log(log::Level::Default, "KxRegistryEntryCreateZxProperties failed: 0x%04x", properties.status & 0x3fff);
      continue;
    }
    const plist::Value* location = properties.value.get("locationID");
    if (!location) {
      log::Log(log::Level::Default, "Failed to retrieve %s.", "locationID");
      continue;
    }
    cameras.set("PTPNode", plist::Value(MountEntry{{"LocationID", *location},
                                                   {"DeviceType", plist::Value("PTPCamera")}}));
  }
  return cameras;
}

}  // namespace brisvale
