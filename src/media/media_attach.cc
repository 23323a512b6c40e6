#include "media/media_attach.h"

#include "base/log.h"
#include "inventory/inventory.h"
#include "media/keep_alive.h"
#include "media/mass_storage_mount.h"
#include "media/user_alerts.h"

namespace brisvale {
namespace {

constexpr std::string_view kEfiPartitionType = "C12A7328-F81F-11D2-BA4B-00A0C93EC93B";
constexpr std::string_view kPartitionMapType = "Vantrel_partition_map";
constexpr size_t kPathCapacity = 1024;

std::optional<bool> BooleanProperty(const plist::Dictionary& properties, std::string_view key) {
  const plist::Value* value = properties.find(key);
  return value ? value->boolean() : std::nullopt;
}

// "/dev/<name>" for a name that stays a single entry of /dev and fits a path buffer.
std::optional<std::string> DeviceNodePath(const std::string& bsdName) {
  if (bsdName.empty() || bsdName == "." || bsdName == ".." ||
      bsdName.find_first_of(std::string_view("/\0", 2)) != std::string::npos) {
    return std::nullopt;
  }
  std::string path = "/dev/" + bsdName;
  if (path.size() >= kPathCapacity) return std::nullopt;
  return path;
}

// Runs the filters over one medium; the first that rejects it logs why.
void InspectMedium(const registry::ObjectRef& media, const MediaMountFunction& mount,
                   const MediaAlertFunction& alert) {
  Log(Level::Debug, "Inspecting the attached media.");
  if (IsDiskImageDevice(media)) return;  // disk images are mounted by their own requests

  const registry::Result<plist::Value> snapshot = media->CopyProperties();
  if (!snapshot.ok()) {
    Log(Level::Default, "KxRegistryEntryCreateZxProperties failed: %04x", snapshot.status & 0x3FFF);
    return;
  }
  const plist::Dictionary* properties = snapshot.value.dictionary();
  if (!properties) {
    Log(Level::Default, "Failed to retrieve properties for the matched service.");
    return;
  }
  const plist::Value* bsdNameValue = properties->find("BSD Name");
  const std::string* bsdName = bsdNameValue ? bsdNameValue->string() : nullptr;
  if (!bsdName) {
    Log(Level::Default, "Failed to retrieve %@.", "BSD Name");
    return;
  }
  if (const plist::Value* content = properties->find("Content")) {
    const std::string* type = content->string();
    if (type && *type == kEfiPartitionType) {
      Log(Level::Debug, "Ignoring EFI partition.");
      return;
    }
    if (type && *type == kPartitionMapType) {
      Log(Level::Debug, "Ignoring Vantrel_partition_map partition.");
      return;
    }
    Log(Level::Debug, "Attached media content type: %@", *content);
  }
  const std::optional<bool> removable = BooleanProperty(*properties, "Removable");
  if (!removable) {
    Log(Level::Default, "Failed to retrieve %@ for %@.", "Removable", *bsdName);
    return;
  }
  // A partition says it is not removable even when the USB disk it sits on is.
  if (!*removable && !HasRemovableAncestor(media)) {
    Log(Level::Default, "The attached media %@ is not removable, ignoring.", *bsdName);
    return;
  }
  const std::optional<bool> leaf = BooleanProperty(*properties, "Leaf");
  if (!leaf) {
    Log(Level::Default, "Failed to retrieve %@ for %@.", "Leaf", *bsdName);
    return;
  }
  const bool readOnly = BooleanProperty(*properties, "Writable") != true;
  if (!*leaf) {
    Log(Level::Debug, "The attached media %@ is not a leaf, ignoring.", *bsdName);
    return;
  }
  const std::optional<std::string> nodePath = DeviceNodePath(*bsdName);
  if (!nodePath) {
    Log(Level::Default, "Failed to create string.");
    return;
  }
  // Every event delivers all media again; the mount table says which are done.
  const std::optional<DeviceMap> mounted = CopyMountedFilesystemMap();
  if (mounted && mounted->find(*nodePath)) {
    Log(Level::Default, "%s is already mounted.", *nodePath);
    return;
  }
  Log(Level::Debug, "Attempting to mount %@ (%s)", *nodePath, readOnly ? "read only" : "read/write");

  bool verificationFailed = false;
  bool mountFailed = false;
  if (mount(*nodePath, readOnly, verificationFailed, mountFailed)) return;
  if (verificationFailed) {
    Log(Level::Default, "Failed to mount %@: verification failed", *nodePath);
    alert("VERIFICATION_FAILURE_TITLE", "VERIFICATION_FAILURE_BODY", "BUTTON_LABEL", media);
  }
  if (mountFailed) {
    Log(Level::Default, "Failed to mount %@.", *nodePath);
    alert("MOUNT_FAILURE_TITLE", "MOUNT_FAILURE_BODY", "BUTTON_LABEL", media);
  }
}

}  // namespace

void InspectAttachedMedia(registry::Iterator& iterator, const MediaMountFunction& mount,
                          const MediaAlertFunction& alert) {
  ScopedKeepAlive keepAlive;
  Log(Level::Debug, "-- MEDIA ATTACHED CALLBACK --");
  while (const registry::ObjectRef media = iterator.Next()) InspectMedium(media, mount, alert);
}

void HandleMediaAttached(MatchingContext&, registry::Iterator& iterator) {
  InspectAttachedMedia(iterator, &MountMassStorageDevice, &ShowUserAlert);
}

}  // namespace brisvale
