#include "media/mass_storage_mount.h"

#include <cerrno>
#include <vector>

#include "base/log.h"
#include "base/utf8.h"
#include "inventory/inventory.h"
#include "media/fs_check.h"
#include "media/fs_identify.h"
#include "media/hfs_mount.h"
#include "platform/os.h"
#include "platform/services.h"
#include "platform/system_notify.h"

namespace brisvale {
namespace {

constexpr const char* kMountedNotification = "com.vantrel.brisvale_mounted";
// The type name every recorded-but-unmounted FAT or exFAT medium carries.
constexpr const char* kUnmountedTypeName = "exfat";
static_assert(sizeof("exfat") <= 16, "the type name must fit its 16-byte field");

// What statfs answers for a mount point: the topmost file system mounted on it, found in
// the mount table under the point's canonical path (/var is a link to /private/var).
int StatMountedFilesystem(os::Os& system, const std::string& mountPath, os::MountRecord& record) {
  std::string canonical;
  if (const int error = system.RealPath(mountPath.c_str(), canonical); error < 0) return error;
  std::vector<os::MountRecord> table;
  if (const int filled = os::CopyMountTable(system, table); filled < 0) return filled;
  for (auto it = table.rbegin(); it != table.rend(); ++it) {
    if (it->mountedOn == canonical) {
      record = *it;
      return 0;
    }
  }
  return -EINVAL;  // nothing is mounted there
}

std::optional<std::string> AnnounceMount(std::string_view deviceNode, const os::MountRecord& record) {
  const std::optional<MountEntry> entry = CreateMapEntryFromMount(record);
  if (!entry) {
    Log(Level::Default, "Failed to create map entry for %@.", deviceNode);
    return std::nullopt;
  }
  const plist::Value* mountPath = entry->find("MountPath");
  if (!mountPath || !mountPath->string()) {
    Log(Level::Default, "Map entry for %@ missing key: %@", deviceNode, "MountPath");
    return std::nullopt;
  }
  Log(Level::Default, "Posting notification: %@", kMountedNotification);
  if (notify::SystemNotify* center = CurrentServices().notify) center->Post(notify::Named(kMountedNotification));
  return *mountPath->string();
}

}  // namespace

std::optional<std::string> MountMassStorageDevice(std::string_view deviceNode, bool readOnly,
                                                  bool& verificationFailed, bool& mountFailed) {
  if (deviceNode.size() >= os::kPathBufferSize || !utf8::IsValid(deviceNode) ||
      deviceNode.find('\0') != std::string_view::npos) {
    Log(Level::Default, "Failed to create string.");
    return std::nullopt;
  }
  const std::string path(deviceNode);
  os::Os& system = *CurrentServices().os;
  const FsType type = IdentifyFilesystem(path.c_str(), [&system](const char* node, os::VolumeHeaderSpan header) {
    return system.ReadVolumeHeader(node, header);
  });

  os::MountRecord record;
  switch (type) {
    case FsTypeUnknown:
    case FsTypeNTFS:
      Log(Level::Default, "Unknown or unsupported filesystem at %s: [%s].", path.c_str(), FsTypeLabel(type));
      mountFailed = true;
      return std::nullopt;
    case FsTypeFAT:
    case FsTypeExFAT:
      // Listed so clients see the medium, never mounted: the node stands in for the mount.
      Log(Level::Debug, "%s filesystem at %s. Skipping mount.", FsTypeLabel(type), path.c_str());
      record.mountedOn = path;
      record.mountedFrom = path;
      record.typeName = kUnmountedTypeName;
      break;
    case FsTypeHFSPlus:
    case FsTypeHFSX: {
      Log(Level::Default, "%s filesystem at %s, preparing to mount.", FsTypeLabel(type), path.c_str());
      if (!IsFilesystemClean(path.c_str(), type)) {
        Log(Level::Debug, "The filesystem at %s appears to be dirty.", path.c_str());
      }
      // Repaired whatever the quick check said: a clean flag does not prove consistency.
      if (RepairFilesystem(path.c_str(), type) != 0) {
        verificationFailed = true;
        return std::nullopt;
      }
      Log(Level::Debug, "Successfully repaired %s.", path.c_str());
      std::string mountPath;
      if (MountHFSDevice(path.c_str(), mountPath, type, readOnly) != 0) {
        mountFailed = true;
        return std::nullopt;
      }
      Log(Level::Default, "Successfully mounted %s.", mountPath.c_str());
      if (const int error = StatMountedFilesystem(system, mountPath, record); error < 0) {
        Log(Level::Default, "Failed to statfs %s: %{errno}d", mountPath.c_str(), -error);
        return std::nullopt;
      }
      break;
    }
    default:
      Log(Level::Default, "Unsupported filesystem type: %d", static_cast<int>(type));
      return std::nullopt;
  }
  return AnnounceMount(deviceNode, record);
}

void HandleMassStorageMount(const plist::Value& request, plist::Dictionary& reply) {
  const plist::Value* node = request.get("DeviceNode");
  if (!node || !node->string()) {
    Log(Level::Default, "Invalid value for %@: %@", "DeviceNode", node);
    return;
  }
  const std::string& deviceNode = *node->string();
  const std::optional<MountEntry> attached = CopyMassStorageEntryForDeviceNode(deviceNode);
  if (!attached || attached->empty()) {
    Log(Level::Default, "There is no matching mass storage entry for %@.", deviceNode);
    return;
  }
  if (const std::optional<DeviceMap> mounted = CopyMountedFilesystemMap()) {
    const plist::Value* entry = mounted->find(deviceNode);
    if (entry && entry->get("IsMounted") && *entry->get("IsMounted") == plist::Value::Bool(true)) {
      Log(Level::Default, "%@ is already mounted.", deviceNode);
      return;
    }
  }
  // Only a boolean true asks for read-only; a string or a number, whatever it says, does not.
  const plist::Value* readOnlyValue = request.get("MountReadOnly");
  const bool readOnly = readOnlyValue && *readOnlyValue == plist::Value::Bool(true);

  bool verificationFailed = false;
  bool mountFailed = false;
  if (std::optional<std::string> mountPath =
          MountMassStorageDevice(deviceNode, readOnly, verificationFailed, mountFailed)) {
    reply.set("MountPath", plist::Value(std::move(*mountPath)));
    reply.set("Status", plist::Value("Success"));
    return;
  }
  if (verificationFailed) Log(Level::Default, "Failed to mount %@: verification issues", deviceNode);
  if (mountFailed) Log(Level::Default, "Failed to mount %@.", deviceNode);
}

}  // namespace brisvale
