#include "daemon/unmount.h"

#include <cerrno>
#include <cstdint>
#include <cstring>
#include <optional>
#include <string>

#include "base/log.h"
#include "base/unique_fd.h"
#include "daemon/request_handlers.h"
#include "platform/os.h"
#include "platform/services.h"
#include "platform/system_notify.h"

namespace brisvale {
namespace {


constexpr const char* kUnmountedNotification = "com.vantrel.brisvale_unmounted";
// Mount points under this prefix are fixed directories of the system image.
constexpr std::string_view kKeptMountPointPrefix = "/Developer";

// Ejects `deviceNode` only when it is the block device numbered `heldBy`; the mount
// table's source is text anyone mounting can choose, so it names no device by itself.
void EjectDeviceHolding(const char* deviceNode, std::optional<uint64_t> heldBy) {
  os::Os& os = *CurrentServices().os;
  if (!heldBy) {
    Log(Level::Default, "Failed to eject %s : %{errno}d", deviceNode, ENODEV);
    return;
  }
  const int opened = os.OpenDevice(deviceNode);
  if (opened < 0) {
    Log(Level::Default, "Failed to open %s : %{errno}d", deviceNode, -opened);
    return;
  }
  const UniqueFd device(opened);
  uint64_t number = 0;
  int rc = os.DeviceNumber(device.get(), number);
  if (rc == 0 && number != *heldBy) rc = -ENODEV;
  if (rc == 0) rc = os.EjectDevice(device.get());
  if (rc < 0) Log(Level::Default, "Failed to eject %s : %{errno}d", deviceNode, -rc);
}

}  // namespace

void EjectDevice(const char* deviceNode) {
  os::Os& os = *CurrentServices().os;
  const int opened = os.OpenDevice(deviceNode);
  if (opened < 0) {
    Log(Level::Default, "Failed to open %s : %{errno}d", deviceNode, -opened);
    return;
  }
  const UniqueFd device(opened);
  if (const int rc = os.EjectDevice(device.get()); rc < 0) {
    Log(Level::Default, "Failed to eject %s : %{errno}d", deviceNode, -rc);
  }
}

void HandleUnmount(const plist::Value& request, plist::Dictionary& reply) {
  const plist::Value* mountPathValue = request.get("MountPath");
  if (!mountPathValue || !mountPathValue->string()) {
    Log(Level::Default, "Invalid value for %@: %@", plist::Value("MountPath"), mountPathValue);
    return;
  }
  const std::string& mountPath = *mountPathValue->string();
  const std::optional<MountEntry> entry = CopyEntryForMountPath(mountPath);
  if (!entry) {
    Log(Level::Default, "There is no matching entry in the device map for %@.", *mountPathValue);
    return;
  }
  const plist::Value* deviceNode = entry->find("DeviceNode");
  if (!deviceNode || !deviceNode->string()) {
    Log(Level::Default, "Could not extract %@ from map entry", plist::Value("DeviceNode"));
    return;
  }

  os::Os& os = *CurrentServices().os;
  // Which device holds the file system can only be asked while it is mounted.
  std::optional<uint64_t> heldBy;
  if (uint64_t device = 0; os.MountedDevice(mountPath.c_str(), device) == 0) heldBy = device;
  if (const int rc = os.Unmount(mountPath.c_str(), /*force=*/true); rc < 0) {
    Log(Level::Default, "Failed to force unmount %@: %s", *mountPathValue, std::strerror(-rc));
    return;
  }
  if (!std::string_view(mountPath).starts_with(kKeptMountPointPrefix)) {
    // Only an empty directory goes: anything created in it while the file system
    // covered it stays, and so does the device, unejected and unannounced.
    if (const int rc = os.RemoveDirectory(mountPath.c_str()); rc < 0) {
      Log(Level::Default, "Failed to remove %@: %s", *mountPathValue, std::strerror(-rc));
      return;
    }
  }
  EjectDeviceHolding(deviceNode->string()->c_str(), heldBy);
  Log(Level::Debug, "Posting a notification that regular storage has been unmounted");
  if (notify::SystemNotify* center = CurrentServices().notify) center->Post(notify::Named(kUnmountedNotification));
  reply.set("Status", plist::Value("Success"));
}

}  // namespace brisvale
