// Placeholder bodies while the inventory is written.
#include "inventory/inventory.h"

namespace brisvale {

std::optional<DeviceMap> CopyMountedFilesystemMap() { return DeviceMap{}; }
std::optional<MountEntry> CreateMapEntryFromMount(const os::MountRecord&) { return std::nullopt; }
std::optional<std::string> CopyBackingImagePath(const char*) { return std::nullopt; }
std::optional<std::string> CopySignatureTextFromImagePath(std::string_view) { return std::nullopt; }
bool IsDiskImageDevice(const registry::ObjectRef&) { return false; }
void HandleCopyDevices(const plist::Value&, plist::Dictionary&) {}
std::optional<DeviceMap> CopyAttachedDevices() { return DeviceMap{}; }
std::optional<DeviceMap> CopyAttachedMediaEntries() { return DeviceMap{}; }
std::optional<DeviceMap> CopyCameraEntries() { return DeviceMap{}; }
std::optional<plist::Array> CopyEntriesMatching(std::string_view, std::string_view, const plist::Value&) {
  return plist::Array{};
}
std::optional<MountEntry> CopyMassStorageEntryForDeviceNode(std::string_view) { return std::nullopt; }
std::optional<plist::Array> CopyDiskImageEntriesOfType(std::string_view) { return plist::Array{}; }
std::optional<MountEntry> CopyEntryForMountPath(std::string_view) { return std::nullopt; }
bool HasRemovableAncestor(const registry::ObjectRef&) { return false; }

}  // namespace brisvale
