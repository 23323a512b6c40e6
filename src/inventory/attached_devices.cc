// Attached-device enumeration: removable media from the registry, cameras and the
// mounted-filesystem map combined into one DeviceMap, and the lookups the rest of the
// daemon finds its devices with. Nothing is cached; every call asks again.
#include <string>

#include "base/log.h"
#include "inventory/inventory.h"
#include "inventory/paths.h"
#include "media/cameras.h"
#include "platform/os.h"
#include "media/fs_identify.h"
#include "platform/services.h"

namespace brisvale {
namespace {


constexpr std::string_view kEfiSystemPartition = "C12A7328-F81F-11D2-BA4B-00A0C93EC93B";
constexpr std::string_view kPartitionMap = "Vantrel_partition_map";

bool IsTrue(const plist::Value* value) { return value && value->boolean() == true; }

void MergeInto(DeviceMap& target, const std::optional<DeviceMap>& source) {
  if (!source) return;
  for (const auto& [key, entry] : *source) target.set(key, entry);
}

// The entry describing one medium, or none when it is not listed.
std::optional<MountEntry> EntryForMedia(const registry::ObjectRef& media, std::string& devicePath) {
  const registry::Result<plist::Value> copied = media->CopyProperties();
  if (!copied.ok()) {
    Log(Level::Default, "KxRegistryEntryCreateZxProperties failed: 0x%04x", copied.status & 0x3fff);
    return std::nullopt;
  }
  const plist::Dictionary* properties = copied.value.dictionary();
  if (!properties) {
    Log(Level::Default, "Failed to retrieve any properties for the matched service.");
    return std::nullopt;
  }
  const plist::Value* bsdName = properties->find("BSD Name");
  if (!bsdName || !bsdName->string()) {
    Log(Level::Default, "Failed to retrieve %s.", "BSD Name");
    return std::nullopt;
  }
  devicePath = "/dev/" + *bsdName->string();
  if (devicePath.size() >= os::kPathBufferSize) {
    Log(Level::Default, "Failed to create string.");
    return std::nullopt;
  }
  const auto missing = [&](const char* flag) {
    Log(Level::Default, "The attached media object %@ does not have a '%s' flag.", *bsdName, flag);
    return std::nullopt;
  };

  const plist::Value* content = properties->find("Content");
  if (!content) return missing("Content");
  if (*content == plist::Value(kEfiSystemPartition)) {
    Log(Level::Debug, "Ignoring EFI partition.");
    return std::nullopt;
  }
  if (*content == plist::Value(kPartitionMap)) {
    Log(Level::Debug, "Ignoring Vantrel_partition_map partition.");
    return std::nullopt;
  }
  const plist::Value* removable = properties->find("Removable");
  if (!removable) return missing("Removable");
  if (!IsTrue(removable) && !HasRemovableAncestor(media)) {
    Log(Level::Debug, "The attached media %@ is not removable, ignoring.", *bsdName);
    return std::nullopt;
  }
  const plist::Value* leaf = properties->find("Leaf");
  if (!leaf) return missing("Leaf");
  const bool readOnly = !IsTrue(properties->find("Writable"));
  if (!IsTrue(leaf)) {
    Log(Level::Debug, "The attached media %@ is not a leaf, ignoring.", *bsdName);
    return std::nullopt;
  }

  os::Os& os = *CurrentServices().os;
  const FsType type = IdentifyFilesystem(devicePath.c_str(), [&os](const char* path, VolumeHeaderSpan header) {
    return os.ReadVolumeHeader(path, header);
  });
  if (type == FsTypeFAT || type == FsTypeExFAT || type == FsTypeNTFS) {
    // These are listed as if mounted at their device path; nothing mounts them.
    const os::MountRecord record{0, "exfat", devicePath, devicePath};
    std::optional<MountEntry> entry = CreateMapEntryFromMount(record);
    if (!entry) Log(Level::Default, "Failed to create map entry for %s.", devicePath.c_str());
    return entry;
  }
  return MountEntry{
      {"DeviceType", plist::Value("MassStorage")},
      {"DeviceNode", plist::Value(devicePath)},
      {"IsMounted", plist::Value::Bool(false)},
      {"IsReadOnly", plist::Value::Bool(readOnly)},
  };
}

}  // namespace

void HandleCopyDevices(const plist::Value&, plist::Dictionary& reply) {
  const std::optional<DeviceMap> devices = CopyAttachedDevices();
  if (!devices) {
    Log(Level::Default, "Failed to retrieve attached device list.");
    return;
  }
  plist::Array entries;
  entries.reserve(devices->size());
  for (const auto& [node, entry] : *devices) entries.push_back(entry);
  reply.set("EntryList", plist::Value(std::move(entries)));
  reply.set("Status", plist::Value("Success"));
}

std::optional<DeviceMap> CopyAttachedDevices() {
  DeviceMap devices;
  MergeInto(devices, CopyCameraEntries());
  MergeInto(devices, CopyAttachedMediaEntries());
  MergeInto(devices, CopyMountedFilesystemMap());
  return devices;
}

std::optional<DeviceMap> CopyAttachedMediaEntries() {
  auto media = CurrentServices().registry->GetMatchingServices(registry::Matching::Class("KxMedia"));
  if (!media.ok() || !media.value) return std::nullopt;
  DeviceMap entries;
  while (const registry::ObjectRef object = media.value->Next()) {
    if (IsDiskImageDevice(object)) continue;
    std::string devicePath;
    if (std::optional<MountEntry> entry = EntryForMedia(object, devicePath)) {
      entries.set(devicePath, plist::Value(std::move(*entry)));
    }
  }
  return entries;
}

bool HasRemovableAncestor(const registry::ObjectRef& media) {
  for (registry::ObjectRef current = media; current;) {
    const std::optional<plist::Value> removable = current->Property("removable");
    if (removable && IsTrue(&*removable)) return true;
    const registry::Result<registry::ObjectRef> parent = current->Parent();
    if (!parent.ok()) {
      if (parent.status != registry::kNoDevice) {
        Log(Level::Default, "KxRegistryEntryGetParentEntry failed: 0x%04x", parent.status & 0x3fff);
      }
      return false;
    }
    current = parent.value;
  }
  return false;
}

std::optional<plist::Array> CopyEntriesMatching(std::string_view deviceType, std::string_view key,
                                                const plist::Value& value) {
  const std::optional<DeviceMap> devices = CopyAttachedDevices();
  if (!devices) {
    Log(Level::Debug, "Failed to retrieve the list of attached devices.");
    return std::nullopt;
  }
  plist::Array matches;
  for (const auto& [node, entry] : *devices) {
    const plist::Value* type = entry.get("DeviceType");
    if (!type) {
      Log(Level::Default, "Invalid value for %@.", plist::Value("DeviceType"));
      continue;
    }
    const plist::Value* found = entry.get(key);
    if (*type == plist::Value(deviceType) && found && *found == value) matches.push_back(entry);
  }
  return matches;
}

std::optional<MountEntry> CopyMassStorageEntryForDeviceNode(std::string_view deviceNode) {
  std::optional<plist::Array> matches = CopyEntriesMatching("MassStorage", "DeviceNode", plist::Value(deviceNode));
  if (!matches || matches->empty() || !matches->front().dictionary()) return std::nullopt;
  return *matches->front().dictionary();
}

std::optional<plist::Array> CopyDiskImageEntriesOfType(std::string_view diskImageType) {
  return CopyEntriesMatching("DiskImage", "DiskImageType", plist::Value(diskImageType));
}

std::optional<MountEntry> CopyEntryForMountPath(std::string_view mountPath) {
  const std::optional<DeviceMap> devices = CopyAttachedDevices();
  if (!devices) {
    Log(Level::Debug, "Failed to retrieve the list of attached devices.");
    return std::nullopt;
  }
  const plist::Value wanted(mountPath);
  for (const auto& [node, entry] : *devices) {
    const plist::Value* path = entry.get("MountPath");
    if (path && *path == wanted && entry.dictionary()) return *entry.dictionary();
  }
  return std::nullopt;
}

}  // namespace brisvale
