// The device inventory: what is attached and what is mounted under the daemon's mount
// roots, rebuilt from the device registry and the kernel's mount table on every call
// (the daemon keeps no list of its own mounts). "CopyDevices" answers with it; unmount,
// sync, clean-up and mounting find their device through the lookups here.
//
// A MountEntry is a dictionary describing one device, camera or mounted file system; a
// DeviceMap is a dictionary of MountEntry keyed by device node (a camera under
// "PTPNode"). Both are plain values owned by the caller.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "base/plist.h"
#include "platform/device_registry.h"
#include "platform/os.h"

namespace brisvale {

using MountEntry = plist::Dictionary;
using DeviceMap = plist::Dictionary;

// The roots a mounted file system must lie under (as a plain character prefix) to be
// the daemon's.
inline constexpr std::string_view kMountRoots[] = {
    "/private/var/personalized_automation",
    "/private/var/personalized_debug",
    "/Developer",
    "/private/var/personalized_demo",
    "/private/var/personalized_factory",
    "/private/var/debug_mount",
    "/private/var/factory_mount",
    "/private/var/mnt",
};

// The mounted file systems under the mount roots, keyed by device node; empty when the
// mount table cannot be read.
std::optional<DeviceMap> CopyMountedFilesystemMap();
// Describes one mount-table record; also used to describe a file system just mounted.
std::optional<MountEntry> CreateMapEntryFromMount(const os::MountRecord& record);
// The disk-image file behind a device node such as /dev/loop3.
std::optional<std::string> CopyBackingImagePath(const char* deviceNode);
// The signature's hex text kept in the two directory names above the image file.
std::optional<std::string> CopySignatureTextFromImagePath(std::string_view imagePath);
// True when an ancestor of `entry` is the disk-image driver's drive object.
bool IsDiskImageDevice(const registry::ObjectRef& entry);

// The "CopyDevices" handler: "EntryList" is the combined map's entries.
void HandleCopyDevices(const plist::Value& request, plist::Dictionary& reply);

// Cameras, attached media and mounted file systems in one map, later sources replacing
// earlier ones under the same key.
std::optional<DeviceMap> CopyAttachedDevices();
// Removable media in the registry, mounted or not, keyed by device path.
std::optional<DeviceMap> CopyAttachedMediaEntries();
// Entries of `deviceType` whose `key` holds `value`.
std::optional<plist::Array> CopyEntriesMatching(std::string_view deviceType, std::string_view key,
                                                const plist::Value& value);
std::optional<MountEntry> CopyMassStorageEntryForDeviceNode(std::string_view deviceNode);
std::optional<plist::Array> CopyDiskImageEntriesOfType(std::string_view diskImageType);
// The first entry whose "MountPath" is `mountPath`.
std::optional<MountEntry> CopyEntryForMountPath(std::string_view mountPath);
// True when `media` or an ancestor carries "removable" = true.
bool HasRemovableAncestor(const registry::ObjectRef& media);

}  // namespace brisvale
