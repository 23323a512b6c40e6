#include "diskimage/mount_request.h"

#include "base/log.h"
#include "daemon/request_handlers.h"
#include "daemon/unmount.h"
#include "diskimage/mount_locations.h"
#include "diskimage/verified_mount.h"
#include "inventory/inventory.h"
#include "jobs/image_jobs.h"
#include "media/mass_storage_mount.h"
#include "platform/os.h"
#include "platform/services.h"
#include "platform/system_notify.h"

namespace brisvale {
namespace {

constexpr const char* kDiskImageMountedNotification = "com.vantrel.mobile.disk_image_mounted";
constexpr const char* kNotificationObject = "BrisvaleMounter";

// The value of `key` when it is of the kind `accessor` reads; logs otherwise.
template <typename T>
const T* RequestValue(const plist::Value& request, const char* key,
                      const T* (plist::Value::*accessor)() const) {
  const plist::Value* value = request.get(key);
  const T* typed = value ? (value->*accessor)() : nullptr;
  if (!typed) Log(Level::Default, "Invalid value for %@: %@", plist::Value(key), value);
  return typed;
}

const char* SubTypeText(const MountLocation& location) {
  return location.subType ? location.subType->c_str() : "(null)";
}

void Announce(const MountLocation& location, const std::string& mountPath, const std::string& type) {
  notify::SystemNotify* center = CurrentServices().notify;
  if (!center) return;
  center->Post(notify::Named(location.typeNotification));
  center->Post(notify::Notification{
      kDiskImageMountedNotification, plist::Value(kNotificationObject),
      plist::Dictionary{{"DiskImageMountPath", plist::Value(mountPath)},
                        {"DiskImageType", plist::Value(type)}},
      true});
}

}  // namespace

void HandleMountRequest(MatchingContext& context, const plist::Value& request,
                        plist::Dictionary& reply) {
  const std::string* deviceType = RequestValue(request, "DeviceType", &plist::Value::string);
  if (!deviceType) return;
  if (*deviceType == "MassStorage") {
    HandleMassStorageMount(request, reply);
  } else if (*deviceType == "DiskImage") {
    HandleDiskImageMount(context, request, reply);
  } else {
    Log(Level::Default, "Unsupported device type: %@", *deviceType);
  }
}

void HandleDiskImageMount(MatchingContext& context, const plist::Value& request,
                          plist::Dictionary& reply) {
  const std::string* type = RequestValue(request, "DiskImageType", &plist::Value::string);
  if (!type) return;
  const plist::Bytes* signature = RequestValue(request, "ImageSignature", &plist::Value::data);
  if (!signature) return;
  const std::string* imagePath = RequestValue(request, "DiskImagePath", &plist::Value::string);
  if (!imagePath) return;

  const std::optional<MountLocation> location = ResolveMountLocation(*type, *signature);
  if (!location) return;

  if (const auto entries = CopyDiskImageEntriesOfType(*type)) {
    for (const plist::Value& entry : *entries) {
      const std::string* mounted = entry.getString("MountPath");
      if (mounted && *mounted == location->mountPath) {
        Log(Level::Default, "A disk image of type %@/%s is already mounted at %@.", *type,
            SubTypeText(*location), *mounted);
        return;
      }
    }
  }

  const VerifiedMountResult mounted = MountVerifiedImage(
      context, VerifiedMountRequest{*imagePath, *type, *signature, location->certificatePath,
                                    location->mountPath});
  std::string mountPath = location->mountPath;
  if (!mounted.deviceNode) {
    if (!mounted.existingMountPath) return;
    mountPath = *mounted.existingMountPath;
  } else {
    if (LoadImageJobs(mountPath, *type) != 0) {
      Log(Level::Default, "Failed to load orbitd jobs for %@.", mountPath);
      CurrentServices().os->Unmount(mountPath.c_str(), /*force=*/true);
      EjectDevice(mounted.deviceNode->c_str());
      return;
    }
    Announce(*location, mountPath, *type);
  }
  reply.set("MountPath", plist::Value(mountPath));
  reply.set("Status", plist::Value("Success"));
}

}  // namespace brisvale
