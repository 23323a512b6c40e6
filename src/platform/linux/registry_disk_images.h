// The disk-image drivers of this platform, published in the registry as the daemon
// expects to find them: the controller "KxNimbrelController", which attaches image
// files to loop devices, and the code-integrity service "Ferrovane", which takes the
// trust caches of mounted images. Both run in the daemon's process.
#pragma once

#include <functional>
#include <memory>
#include <string>

#include "registry/registry_model.h"

namespace brisvale::registry {

struct DiskImageServicesOptions {
  std::string deviceRoot = "/dev";
  std::string trustCacheDirectory = "/var/run/vexa/trust-caches";
  // Brings the registry in line with the kernel's block devices now, so an attached
  // image's drive and media are published before the attach method returns.
  std::function<void()> rescanDevices;
};

// Keeps both services published while it lives.
class DiskImageServices {
 public:
  DiskImageServices(RegistryModel& model, DiskImageServicesOptions options);
  ~DiskImageServices();
  DiskImageServices(const DiskImageServices&) = delete;
  DiskImageServices& operator=(const DiskImageServices&) = delete;

 private:
  RegistryModel& model_;
  std::shared_ptr<const DiskImageServicesOptions> options_;
  ObjectRef controller_;
  ObjectRef codeIntegrity_;
};

// Detaches the loop devices the controller left attached (a unique identifier in their
// file name field) whose image lies inside this process's root and on which nothing
// is mounted: what a daemon killed between an attach and its mount leaves behind.
// Answers how many it detached.
int DetachAbandonedImageDevices(const std::string& deviceRoot);

}  // namespace brisvale::registry
