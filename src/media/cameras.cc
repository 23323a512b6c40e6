#include "media/cameras.h"

#include "base/log.h"
#include "media/keep_alive.h"
#include "platform/services.h"
#include "platform/system_notify.h"

namespace brisvale {
namespace {

constexpr const char* kCameraAttachedNotification = "com.vantrel.mobile.camera_attached";

// The two-key record that describes a camera in the notification and in the list.
std::optional<plist::Dictionary> CameraRecord(const registry::ObjectRef& camera) {
  const registry::Result<plist::Value> properties = camera->CopyProperties();
  if (!properties.ok()) {
    Log(Level::Default, "KxRegistryEntryCreateZxProperties failed: 0x%04x",
        properties.status & 0x3FFF);
    return std::nullopt;
  }
  const plist::Value* location = properties.value.get("locationID");
  if (!location) {
    Log(Level::Default, "Failed to retrieve %s.", "locationID");
    return std::nullopt;
  }
  return plist::Dictionary{{"LocationID", *location}, {"DeviceType", plist::Value("PTPCamera")}};
}

}  // namespace

registry::Matching StillImageInterfaceMatching() {
  registry::Matching matching = registry::Matching::Class("KxUSBHostInterface");
  matching.Set("bInterfaceClass", plist::Value::Int(6))
      .Set("bInterfaceSubClass", plist::Value::Int(1))
      .Set("bInterfaceProtocol", plist::Value::Int(1));
  return matching;
}

void HandleCameraAttached(MatchingContext&, registry::Iterator& iterator) {
  ScopedKeepAlive keepAlive;
  Log(Level::Debug, "-- PTP ATTACHED CALLBACK --");
  while (const registry::ObjectRef camera = iterator.Next()) {
    std::optional<plist::Dictionary> record = CameraRecord(camera);
    if (!record) continue;
    Log(Level::Default, "Posting notification: %@", kCameraAttachedNotification);
    if (notify::SystemNotify* notifier = CurrentServices().notify) {
      notify::Notification notification = notify::Named(kCameraAttachedNotification);
      notification.userInfo = std::move(*record);
      notifier->Post(notification);
    }
  }
}

std::optional<plist::Dictionary> CopyCameraEntries() {
  plist::Dictionary cameras;
  auto found = CurrentServices().registry->GetMatchingServices(StillImageInterfaceMatching());
  if (!found.ok() || !found.value) return cameras;
  // The list has one slot: several cameras leave only the last one found.
  while (const registry::ObjectRef camera = found.value->Next()) {
    if (std::optional<plist::Dictionary> record = CameraRecord(camera)) {
      cameras.set("PTPNode", plist::Value(std::move(*record)));
    }
  }
  return cameras;
}

}  // namespace brisvale
