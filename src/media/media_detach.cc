#include "media/media_detach.h"

#include "base/log.h"
#include "inventory/inventory.h"
#include "platform/os.h"
#include "platform/services.h"
#include "platform/system_notify.h"

namespace brisvale {
namespace {

constexpr const char* kUnmountedNotification = "com.vantrel.brisvale_unmounted";
constexpr size_t kPathCapacity = 1024;

const std::string* StringValue(const plist::Dictionary* entry, std::string_view key) {
  const plist::Value* value = entry ? entry->find(key) : nullptr;
  return value ? value->string() : nullptr;
}

void UnmountIfGone(const std::string& node, const plist::Value& value) {
  const plist::Dictionary* entry = value.dictionary();
  const std::string* deviceType = StringValue(entry, "DeviceType");
  if (!deviceType) {
    Log(Level::Default, "%@ entry missing value for key %@.", node, "DeviceType");
    return;
  }
  if (*deviceType != "MassStorage") return;
  // Asked afresh for each node: an earlier forced unmount may have changed the registry.
  // When the registry cannot be read, nothing says the device has gone.
  const std::optional<DeviceMap> attached = CopyAttachedMediaEntries();
  if (!attached || attached->find(node)) return;
  const std::string* mountPath = StringValue(entry, "MountPath");
  if (!mountPath) {
    Log(Level::Default, "%@ entry missing value for key %@.", node, "MountPath");
    return;
  }
  if (mountPath->size() >= kPathCapacity || mountPath->find('\0') != std::string::npos) {
    Log(Level::Default, "Failed to create string.");
    return;
  }
  Log(Level::Debug, "Forcing an unmount of %@ (%@).", *mountPath, node);
  os::Os& os = *CurrentServices().os;
  if (const int result = os.Unmount(mountPath->c_str(), /*force=*/true); result < 0) {
    Log(Level::Default, "Failed to unmount %s: %{errno}d", *mountPath, -result);
    return;  // the directory stays under the dead mount until the next try
  }
  if (const int result = os.RemoveDirectory(mountPath->c_str()); result < 0) {
    Log(Level::Default, "Failed to remove %s: %{errno}d", *mountPath, -result);
  }
}

}  // namespace

void UnmountPulledMedia(const plist::Dictionary& mounted) {
  for (const auto& [node, entry] : mounted) UnmountIfGone(node, entry);
}

void HandleMediaDetached() {
  if (const std::optional<DeviceMap> mounted = CopyMountedFilesystemMap()) {
    UnmountPulledMedia(*mounted);
  } else {
    Log(Level::Debug, "No mounted devices, just posting notification.");
  }
  Log(Level::Default, "Posting notification: %@", kUnmountedNotification);
  if (notify::SystemNotify* notifier = CurrentServices().notify) {
    notifier->Post(notify::Named(kUnmountedNotification));
  }
}

}  // namespace brisvale
