// The mounted-filesystem map: the kernel's mount table filtered to the daemon's mount
// roots, each file system described as a MountEntry, disk images with the signature
// read back from their backing file's path.
#include <algorithm>
#include <vector>

#include "base/hex.h"
#include "base/log.h"
#include "base/utf8.h"
#include "inventory/inventory.h"
#include "inventory/paths.h"
#include "platform/os.h"
#include "platform/services.h"

namespace brisvale {
namespace {


constexpr std::string_view kDiskImageDriveClass = "KxNimbrelHDDriveInKernel";

// The disk image type a mount path gives, first rule that holds; empty for none.
std::string_view DiskImageTypeForMountPath(std::string_view mountPath) {
  if (mountPath == "/Developer") return "Developer";
  if (mountPath.starts_with("/private/var/factory_mount")) return "Factory";
  for (std::string_view root : {"/private/var/personalized_automation", "/private/var/personalized_demo",
                                "/private/var/personalized_debug", "/Developer",
                                "/private/var/personalized_factory"}) {
    if (mountPath.starts_with(root)) return "Personalized";
  }
  return {};
}

bool IsUnderMountRoot(std::string_view mountPath) {
  return std::any_of(std::begin(kMountRoots), std::end(kMountRoots),
                     [&](std::string_view root) { return mountPath.starts_with(root); });
}

// Only names under /dev are devices; the kernel's table also lists pseudo file
// systems ("proc", "tmpfs", "overlay" ...) that no registry object stands for, the way
// the device file system does on the handset.
bool NamesNoDevice(std::string_view deviceNode) {
  return deviceNode == "devfs" || !deviceNode.starts_with("/dev/");
}

}  // namespace

bool IsDiskImageDevice(const registry::ObjectRef& entry) {
  if (!entry) return false;
  for (auto parent = entry->Parent(); parent.ok() && parent.value; parent = parent.value->Parent()) {
    if (parent.value->ConformsTo(kDiskImageDriveClass)) return true;
  }
  return false;
}

std::optional<MountEntry> CreateMapEntryFromMount(const os::MountRecord& record) {
  if (!utf8::IsValid(record.mountedFrom) || !utf8::IsValid(record.mountedOn) ||
      !utf8::IsValid(record.typeName)) {
    Log(Level::Default, "Failed to create string.");
    return std::nullopt;
  }
  MountEntry entry;
  entry.set("DeviceType", plist::Value("MassStorage"));
  entry.set("DeviceNode", plist::Value(record.mountedFrom));
  entry.set("MountPath", plist::Value(record.mountedOn));
  entry.set("FilesystemType", plist::Value(record.typeName));
  entry.set("IsMounted", plist::Value::Bool(true));

  const std::optional<std::string> url = paths::UrlFromText(record.mountedFrom);
  if (!url) {
    Log(Level::Default, "Failed to create URL.");
    return entry;
  }
  const std::optional<std::string_view> name = paths::LastPathComponent(*url);
  if (!name) {
    Log(Level::Default, "Failed to retrieve the last path component for %@.", plist::Value(*url));
    return entry;
  }
  if (name->size() >= os::kPathBufferSize) {
    Log(Level::Default, "Failed to create string.");
    return entry;
  }
  const std::string bsdName(*name);
  const registry::ObjectRef service =
      CurrentServices().registry->GetMatchingService(registry::Matching::BsdName(bsdName));
  if (!service && !NamesNoDevice(record.mountedFrom)) {
    Log(Level::Default, "Failed to retrieve the Kx service matching the device node for %@.",
        plist::Value(record.mountedFrom));
  }
  if (IsDiskImageDevice(service)) {
    entry.set("DeviceType", plist::Value("DiskImage"));
    if (std::string_view type = DiskImageTypeForMountPath(record.mountedOn); !type.empty()) {
      entry.set("DiskImageType", plist::Value(type));
    }
  }
  entry.set("IsReadOnly", plist::Value::Bool((record.flags & os::kMountReadOnly) != 0));
  if (record.flags & os::kMountContentProtection) {
    entry.set("SupportsContentProtection", plist::Value::Bool(true));
  }
  return entry;
}

std::optional<std::string> CopyBackingImagePath(const char* deviceNode) {
  const std::optional<std::string> url = paths::FileUrlFromPath(deviceNode ? deviceNode : "");
  if (!url) {
    Log(Level::Default, "Failed to create URL.");
    return std::nullopt;
  }
  const std::optional<std::string_view> name = paths::LastPathComponent(*url);
  if (!name) {
    Log(Level::Default, "Failed to copy last path component for %@.", plist::Value(*url));
    return std::nullopt;
  }
  const registry::ObjectRef service =
      CurrentServices().registry->GetMatchingService(registry::Matching::BsdName(std::string(*name)));
  if (!service) {
    Log(Level::Default, "KxServiceGetMatchingService failed.");
    return std::nullopt;
  }
  for (const registry::ObjectRef& ancestor : registry::Ancestors(service)) {
    const std::optional<plist::Value> imagePath = ancestor->Property("image-path");
    if (imagePath && imagePath->data()) return paths::Latin1ToUtf8(*imagePath->data());
  }
  return std::nullopt;
}

std::optional<std::string> CopySignatureTextFromImagePath(std::string_view imagePath) {
  const std::vector<std::string_view> components = paths::PathComponents(imagePath);
  if (components.size() < 4) return std::nullopt;
  const size_t count = components.size();
  return std::string(components[count - 3]) + std::string(components[count - 2]);
}

std::optional<DeviceMap> CopyMountedFilesystemMap() {
  DeviceMap map;
  os::Os& os = *CurrentServices().os;
  std::vector<os::MountRecord> records;
  const int count = os::CopyMountTable(os, records);
  if (count < 1) {
    Log(Level::Default, "Failed to get mount information: %{errno}d", count < 0 ? -count : 0);
    return map;
  }

  for (const os::MountRecord& record : records) {
    std::optional<MountEntry> entry = CreateMapEntryFromMount(record);
    if (!entry) {
      Log(Level::Default, "Failed to create map entry.");
      continue;
    }
    const std::string* mountPath = entry->find("MountPath") ? entry->find("MountPath")->string() : nullptr;
    if (!mountPath) {
      Log(Level::Default, "Map entry missing value for key %@.", plist::Value("MountPath"));
      continue;
    }
    if (!IsUnderMountRoot(*mountPath)) {
      Log(Level::Debug, "Skipping %@, as we didn't mount it.", plist::Value(*mountPath));
      continue;
    }
    const plist::Value* deviceNode = entry->find("DeviceNode");
    if (!deviceNode) {
      Log(Level::Default, "Map entry missing %@.", plist::Value("DeviceNode"));
      continue;
    }
    const plist::Value* deviceType = entry->find("DeviceType");
    if (!deviceType) {
      Log(Level::Default, "Map entry missing %@.", plist::Value("DeviceType"));
      continue;
    }
    if (*deviceType == plist::Value("DiskImage") && !entry->find("ImageSignature")) {
      // Every failure here still keeps the entry, only without its signature.
      if (std::optional<std::string> imagePath = CopyBackingImagePath(record.mountedFrom.c_str()); !imagePath) {
        Log(Level::Default, "Failed to get backing image path for %s", record.mountedOn.c_str());
      } else if (std::optional<std::string> text = CopySignatureTextFromImagePath(*imagePath); !text) {
        Log(Level::Default, "Failed to recover signature from %@", plist::Value(*imagePath));
      } else if (auto signature = BrisvaleMounter::initDataWithHexString(*text); !signature) {
        Log(Level::Default, "Failed to convert signature from %@", plist::Value(*imagePath));
      } else {
        entry->set("ImageSignature", plist::Value(std::move(*signature)));
      }
    }
    const std::string key = *deviceNode->string();
    map.set(key, plist::Value(std::move(*entry)));
  }
  return map;
}

}  // namespace brisvale
