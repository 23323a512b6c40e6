// The machine's own devices in the registry: block devices as "KxMedia" with their
// sysfs ancestors, USB devices and interfaces, and loop devices below a disk-image
// drive object. Kernel events are read as they arrive on the main loop and again,
// without waiting, whenever the daemon refreshes the registry, so a device attached a
// moment ago is never missed. The provider also keeps the device root in step: a
// published medium whose node is missing gets one.
#pragma once

#include <memory>
#include <string>

#include "registry/registry_model.h"

namespace brisvale {
class RunLoop;
}

namespace brisvale::registry {

struct SystemDevicesOptions {
  std::string deviceRoot = "/dev";
};

class SystemDevices : public Provider {
 public:
  // Reads sysfs again and brings the registry in line with it, now (a driver that has
  // just attached a device calls this before it returns).
  virtual void Rescan() = 0;
};

// Publishes what sysfs shows now and keeps it current. `loop` may be null: kernel
// events are then only read on Refresh. Without a kernel event socket (logged), every
// Refresh rescans. Answers null only when sysfs cannot be read at all.
std::unique_ptr<SystemDevices> StartSystemDevices(RegistryModel& model, RunLoop* loop,
                                                  SystemDevicesOptions options);

}  // namespace brisvale::registry
