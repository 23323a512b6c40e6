// Simulated devices: a device tree kept in a property-list file (docs/devices-file.md)
// and mirrored into the registry, so that tests and the demo can plug and pull media
// and cameras this machine does not have by editing the file. The file is read when
// the provider starts and again before each hardware event. An object keeps its
// identity across reads by its path of names in the tree: objects that appear are
// published (first-match notifications fire), objects that disappear are terminated
// (their terminated interest messages fire), objects that stay get their new
// properties.
#pragma once

#include <map>
#include <string>
#include <vector>

#include "registry/registry_model.h"

namespace brisvale::registry {

class SimulatedDevices final : public Provider {
 public:
  // Registers with `model`; call Reload() for the first read.
  SimulatedDevices(RegistryModel& model, std::string path);
  // Unregisters and takes the simulated objects out of the registry.
  ~SimulatedDevices() override;
  SimulatedDevices(const SimulatedDevices&) = delete;
  SimulatedDevices& operator=(const SimulatedDevices&) = delete;

  // Reads the file and brings the registry in line with it. A file that cannot be read
  // or is malformed leaves the registry as it was, logs why and answers false (with
  // the reason in `error`).
  bool Reload(std::string* error = nullptr);
  void Refresh(RefreshReason reason) override;

  // The live object at a path of names ("usb-stick", "disk", "data"); nullptr if none.
  ObjectRef Find(const std::vector<std::string>& path) const;

 private:
  struct Published {
    ObjectRef object;
    std::vector<std::string> chain;
  };
  RegistryModel& model_;
  std::string path_;
  std::map<std::vector<std::string>, Published> objects_;
};

}  // namespace brisvale::registry
