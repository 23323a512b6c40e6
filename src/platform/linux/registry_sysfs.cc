#include "platform/linux/registry_sysfs.h"

#include <libudev.h>
#include <sys/sysmacros.h>

#include <cctype>
#include <charconv>
#include <memory>
#include <set>

#include "base/c_handle.h"

namespace brisvale::registry::sysfs {
namespace {

using DevicePtr = CHandle<udev_device, udev_device_unref>;

std::string_view Text(const char* text) { return text ? std::string_view(text) : std::string_view(); }

std::string Attribute(udev_device* device, const char* name) {
  std::string value(Text(udev_device_get_sysattr_value(device, name)));
  while (!value.empty() && std::isspace(static_cast<unsigned char>(value.back()))) value.pop_back();
  return value;
}

std::optional<int64_t> Number(std::string_view text, int base) {
  int64_t value = 0;
  auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), value, base);
  if (error != std::errc() || end != text.data() + text.size() || text.empty()) return std::nullopt;
  return value;
}

void SetNumber(plist::Dictionary& properties, const char* key, udev_device* device,
               const char* attribute, int base) {
  if (auto value = Number(Attribute(device, attribute), base)) {
    properties.set(key, plist::Value::Int(*value));
  }
}

std::vector<std::string> SyspathsOf(udev* context, const char* subsystem) {
  std::vector<std::string> paths;
  CHandle<udev_enumerate, udev_enumerate_unref> enumerate(udev_enumerate_new(context));
  if (!enumerate) return paths;
  udev_enumerate_add_match_subsystem(enumerate.get(), subsystem);
  udev_enumerate_scan_devices(enumerate.get());
  udev_list_entry* entry;
  udev_list_entry_foreach(entry, udev_enumerate_get_list_entry(enumerate.get())) {
    paths.emplace_back(udev_list_entry_get_name(entry));
  }
  return paths;
}

class Scanner {
 public:
  Scanner(udev* context, const std::string& deviceRoot, ProbeCache& cache)
      : context_(context), deviceRoot_(deviceRoot), cache_(cache) {}

  Snapshot Run() {
    std::vector<DevicePtr> media;
    std::set<std::string> partitioned;  // syspaths of disks that show partitions
    for (const auto& path : SyspathsOf(context_, "block")) {
      DevicePtr device(udev_device_new_from_syspath(context_, path.c_str()));
      if (!device) continue;
      snapshot_.allBlockNames.emplace_back(Text(udev_device_get_sysname(device.get())));
      if (Text(udev_device_get_devtype(device.get())) == "partition") {
        if (udev_device* disk = udev_device_get_parent(device.get())) {
          partitioned.emplace(Text(udev_device_get_syspath(disk)));
        }
      }
      // An empty drive (a loop device with nothing attached, a card reader without a
      // card) has no medium to publish.
      if (Number(Attribute(device.get(), "size"), 10).value_or(0) > 0) {
        media.push_back(std::move(device));
      }
    }
    for (const auto& device : media) {
      bool leaf = !partitioned.contains(std::string(Text(udev_device_get_syspath(device.get()))));
      Add(device.get(), leaf);
    }
    for (const auto& path : SyspathsOf(context_, "usb")) {
      DevicePtr device(udev_device_new_from_syspath(context_, path.c_str()));
      if (device && Text(udev_device_get_devtype(device.get())) == "usb_interface") {
        Add(device.get(), true);
      }
    }
    std::erase_if(cache_.byKey, [&](const auto& item) { return !usedKeys_.contains(item.first); });
    return std::move(snapshot_);
  }

 private:
  // Adds the device after its ancestors; answers its key.
  std::string Add(udev_device* device, bool leaf) {
    std::string syspath(Text(udev_device_get_syspath(device)));
    if (auto it = keyBySyspath_.find(syspath); it != keyBySyspath_.end()) return it->second;

    std::string subsystem(Text(udev_device_get_subsystem(device)));
    std::string devtype(Text(udev_device_get_devtype(device)));
    std::string name(Text(udev_device_get_sysname(device)));
    bool isBlock = subsystem == "block";

    std::string parentKey;
    if (udev_device* parent = udev_device_get_parent(device)) parentKey = Add(parent, false);
    bool isLoopDisk = isBlock && devtype == "disk" && name.starts_with("loop") &&
                      !Attribute(device, "loop/backing_file").empty();
    if (isLoopDisk) parentKey = AddLoopDrive(device, parentKey, name);

    WantedObject object;
    object.parentKey = parentKey;
    object.key = parentKey + "/" + name + Generation(device, subsystem, devtype);
    object.className = ClassForSubsystem(subsystem, devtype);
    if (isBlock) {
      object.properties = MediaProperties(device, object.key, devtype, name, leaf);
    } else {
      object.properties = DeviceProperties(device, subsystem, devtype, name);
    }
    keyBySyspath_.emplace(syspath, object.key);
    snapshot_.objects.push_back(std::move(object));
    return snapshot_.objects.back().key;
  }

  // What tells one attachment of a device from the next at the same place.
  std::string Generation(udev_device* device, const std::string& subsystem,
                         const std::string& devtype) {
    if (subsystem == "block" && devtype == "disk") return "#" + Attribute(device, "diskseq");
    if (subsystem == "usb" && devtype == "usb_device") return "#" + Attribute(device, "devnum");
    return "";
  }

  std::string AddLoopDrive(udev_device* loop, const std::string& parentKey,
                           const std::string& name) {
    WantedObject drive;
    drive.parentKey = parentKey;
    drive.key = parentKey + "/" + name + "-drive#" + Attribute(loop, "diskseq");
    drive.className = "KxNimbrelHDDriveInKernel";
    std::string backing(Text(udev_device_get_sysattr_value(loop, "loop/backing_file")));
    if (!backing.empty() && backing.back() == '\n') backing.pop_back();
    drive.properties.set("image-path", plist::Value(plist::Bytes(backing.begin(), backing.end())));
    std::string node = deviceRoot_ + "/" + name;
    EnsureNode(loop, name);
    ProbeCache::Entry& cached = CacheEntry(drive.key, loop);
    if (!cached.loopIdentifier) cached.loopIdentifier = ReadLoopIdentifier(node);
    if (cached.loopIdentifier) {
      drive.properties.set("nimbrel-unique-identifier", plist::Value(*cached.loopIdentifier));
    }
    snapshot_.objects.push_back(std::move(drive));
    return snapshot_.objects.back().key;
  }

  plist::Dictionary MediaProperties(udev_device* device, const std::string& key,
                                    const std::string& devtype, const std::string& name,
                                    bool leaf) {
    bool whole = devtype != "partition";
    EnsureNode(device, name);
    std::string content;
    if (whole) {
      if (auto table = Table(key, device, name)) content = leaf ? "" : table->scheme;
    } else if (udev_device* disk = udev_device_get_parent(device)) {
      std::string diskName(Text(udev_device_get_sysname(disk)));
      auto diskKey = keyBySyspath_.find(std::string(Text(udev_device_get_syspath(disk))));
      auto number = Number(Attribute(device, "partition"), 10);
      if (diskKey != keyBySyspath_.end() && number) {
        if (auto table = Table(diskKey->second, disk, diskName)) {
          if (auto it = table->contentByNumber.find(static_cast<int>(*number));
              it != table->contentByNumber.end()) {
            content = it->second;
          }
        }
      }
    }
    int64_t sectors = Number(Attribute(device, "size"), 10).value_or(0);
    return plist::Dictionary{
        {"BSD Name", plist::Value(name)},
        {"Removable", plist::Value::Bool(Attribute(device, "removable") == "1")},
        {"Leaf", plist::Value::Bool(leaf)},
        {"Writable", plist::Value::Bool(Attribute(device, "ro") == "0")},
        {"Content", plist::Value(content)},
        {"Whole", plist::Value::Bool(whole)},
        {"Size", plist::Value::Int(sectors * 512)},
    };
  }

  plist::Dictionary DeviceProperties(udev_device* device, const std::string& subsystem,
                                     const std::string& devtype, const std::string& name) {
    plist::Dictionary properties;
    properties.set("Kernel Name", plist::Value(name));
    if (subsystem != "usb") return properties;
    if (auto location = UsbLocationId(name)) {
      properties.set("locationID", plist::Value::Int(*location));
    }
    if (devtype == "usb_device") {
      // sysfs mostly answers "unknown"; only "fixed" marks a device built in.
      properties.set("removable", plist::Value::Bool(Attribute(device, "removable") != "fixed"));
      SetNumber(properties, "idVendor", device, "idVendor", 16);
      SetNumber(properties, "idProduct", device, "idProduct", 16);
    } else if (devtype == "usb_interface") {
      SetNumber(properties, "bInterfaceNumber", device, "bInterfaceNumber", 16);
      SetNumber(properties, "bInterfaceClass", device, "bInterfaceClass", 16);
      SetNumber(properties, "bInterfaceSubClass", device, "bInterfaceSubClass", 16);
      SetNumber(properties, "bInterfaceProtocol", device, "bInterfaceProtocol", 16);
    }
    return properties;
  }

  ProbeCache::Entry& CacheEntry(const std::string& key, udev_device* device) {
    usedKeys_.insert(key);
    auto [it, inserted] = cache_.byKey.try_emplace(key);
    if (inserted) it->second.syspath = Text(udev_device_get_syspath(device));
    return it->second;
  }

  const std::optional<PartitionTable>& Table(const std::string& key, udev_device* disk,
                                             const std::string& name) {
    ProbeCache::Entry& cached = CacheEntry(key, disk);
    if (!cached.table) cached.table = ProbePartitionTable(deviceRoot_ + "/" + name);
    return cached.table;
  }

  void EnsureNode(udev_device* device, const std::string& name) {
    dev_t number = udev_device_get_devnum(device);
    if (major(number) == 0 && minor(number) == 0) return;
    if (!nodesSeen_.insert(name).second) return;
    bool made = EnsureBlockNode(deviceRoot_ + "/" + name, number);
    snapshot_.publishedNodes.push_back(BlockNode{name, number, made});
  }

  udev* context_;
  const std::string& deviceRoot_;
  ProbeCache& cache_;
  Snapshot snapshot_;
  std::map<std::string, std::string> keyBySyspath_;
  std::set<std::string> nodesSeen_;
  std::set<std::string> usedKeys_;
};

}  // namespace

void ProbeCache::Forget(std::string_view syspath) {
  std::erase_if(byKey, [&](const auto& item) { return item.second.syspath == syspath; });
}

Snapshot Scan(udev* context, const std::string& deviceRoot, ProbeCache& cache) {
  return Scanner(context, deviceRoot, cache).Run();
}

std::optional<uint32_t> UsbLocationId(std::string_view kernelName) {
  kernelName = kernelName.substr(0, kernelName.find(':'));
  size_t dash = kernelName.find('-');
  if (dash == std::string_view::npos) return std::nullopt;
  auto bus = Number(kernelName.substr(0, dash), 10);
  if (!bus || *bus > 0xff) return std::nullopt;
  uint32_t location = static_cast<uint32_t>(*bus) << 24;
  std::string_view ports = kernelName.substr(dash + 1);
  if (ports == "0") return location;  // the root hub
  if (ports.empty()) return std::nullopt;
  int shift = 20;
  while (!ports.empty()) {
    size_t dot = ports.find('.');
    auto port = Number(ports.substr(0, dot), 10);
    if (!port || *port < 1) return std::nullopt;
    // Six nibbles hold six tiers; deeper ports and ports above 15 do not fit and
    // are left out or saturated rather than spilling into the neighbouring tier.
    if (shift >= 0) location |= static_cast<uint32_t>(std::min<int64_t>(*port, 0xf)) << shift;
    shift -= 4;
    ports = dot == std::string_view::npos ? std::string_view() : ports.substr(dot + 1);
  }
  return location;
}

std::string ClassForSubsystem(std::string_view subsystem, std::string_view devtype) {
  if (subsystem == "block") return "KxMedia";
  if (subsystem == "usb" && devtype == "usb_interface") return "KxUSBHostInterface";
  if (subsystem == "usb") return "KxUSBHostDevice";
  if (subsystem.empty()) return "KxSysfsDevice";
  std::string name = "Kx";
  bool upper = true;
  for (char c : subsystem) {
    if (!std::isalnum(static_cast<unsigned char>(c))) {
      upper = true;
      continue;
    }
    name += upper ? static_cast<char>(std::toupper(static_cast<unsigned char>(c))) : c;
    upper = false;
  }
  return name + "Device";
}

}  // namespace brisvale::registry::sysfs
