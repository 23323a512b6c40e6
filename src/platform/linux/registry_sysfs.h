// The system-devices provider's view of sysfs: one scan turns the block devices and
// USB interfaces the kernel shows, with all their sysfs ancestors, into the registry
// objects that should exist, each under a key that names its place in the tree.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/plist.h"
#include "platform/linux/registry_probe.h"

struct udev;

namespace brisvale::registry::sysfs {

// An object that should be in the registry. The key is the parent's key plus the
// object's own name (and, for media and USB devices, the kernel's sequence number of
// the attachment), so a device that goes and comes back is a new object.
struct WantedObject {
  std::string key;
  std::string parentKey;  // "" at the top
  std::string className;
  plist::Dictionary properties;
};

// A block device node the provider keeps in the device root.
struct BlockNode {
  std::string name;  // kernel name, also the node's file name
  dev_t number = 0;
  bool made = false;  // this scan created the node
};

struct Snapshot {
  std::vector<WantedObject> objects;      // parents before children
  std::vector<BlockNode> publishedNodes;  // media that are published
  std::vector<std::string> allBlockNames;  // every block device sysfs shows, empty or not
};

// What a scan learned from device nodes, kept between scans because probing opens
// the device. Entries are dropped when the kernel reports a change of that device.
struct ProbeCache {
  struct Entry {
    std::string syspath;
    std::optional<PartitionTable> table;
    std::optional<std::string> loopIdentifier;
  };
  std::map<std::string, Entry> byKey;
  void Forget(std::string_view syspath);
};

Snapshot Scan(udev* context, const std::string& deviceRoot, ProbeCache& cache);

// The USB location of a device or interface from its kernel name ("2-1.4" or
// "2-1.4:1.0"): the bus in the top byte, then one nibble per port of the port path.
// None for a name that is not of that form.
std::optional<uint32_t> UsbLocationId(std::string_view kernelName);

// The registry class of a sysfs device: "KxMedia" for block devices, the USB host
// classes for USB devices and interfaces, "Kx<Subsystem>Device" for the rest.
std::string ClassForSubsystem(std::string_view subsystem, std::string_view devtype);

}  // namespace brisvale::registry::sysfs
