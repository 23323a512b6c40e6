#include "diskimage/attach.h"

#include <array>
#include <cstdio>
#include <cstring>
#include <random>

#include "base/log.h"
#include "daemon/unmount.h"
#include "diskimage/mount_locations.h"
#include "diskimage/volume_mount.h"
#include "platform/device_registry.h"
#include "platform/os.h"
#include "platform/services.h"

namespace brisvale {
namespace {

constexpr std::string_view kControllerClass = "KxNimbrelController";
constexpr std::string_view kUniqueIdentifierKey = "nimbrel-unique-identifier";
constexpr uint32_t kAttachMagic = 0xBEEFFEED;
constexpr uint32_t kAttachVersion = 1;
constexpr size_t kAttachRecordSize = 256;
constexpr uint32_t kAttachSelector = 0;
constexpr size_t kAttachOutputSize = 4;

void PutLittleEndian(uint8_t* at, uint64_t value, size_t size) {
  for (size_t i = 0; i < size; ++i) at[i] = static_cast<uint8_t>(value >> (8 * i));
}

// The 256-byte attach record that points at the serialized property list.
std::array<uint8_t, kAttachRecordSize> AttachRecord(const std::string& propertyList) {
  std::array<uint8_t, kAttachRecordSize> record{};
  PutLittleEndian(&record[0], kAttachMagic, 4);
  PutLittleEndian(&record[4], kAttachVersion, 4);
  PutLittleEndian(&record[8], reinterpret_cast<uintptr_t>(propertyList.data()), 8);
  PutLittleEndian(&record[16], propertyList.size(), 8);
  return record;
}

}  // namespace

std::string CreateUuidString() {
  std::random_device source;
  std::array<uint8_t, 16> bytes;
  for (size_t i = 0; i < bytes.size(); i += 4) {
    const uint32_t word = source();
    std::memcpy(&bytes[i], &word, 4);
  }
  bytes[6] = static_cast<uint8_t>((bytes[6] & 0x0F) | 0x40);  // version 4
  bytes[8] = static_cast<uint8_t>((bytes[8] & 0x3F) | 0x80);  // RFC 4122 variant
  std::string text;
  char hex[3];
  for (size_t i = 0; i < bytes.size(); ++i) {
    if (i == 4 || i == 6 || i == 8 || i == 10) text += '-';
    std::snprintf(hex, sizeof hex, "%02X", bytes[i]);
    text += hex;
  }
  return text;
}

std::optional<std::string> AttachDiskImage(std::string_view imagePath, const VerifiedFile* verified) {
  if (imagePath.size() > kMaxImagePathLength) {
    Log(Level::Default, "Failed to create string.");
    return std::nullopt;
  }
  std::string identifier = CreateUuidString();
  plist::Dictionary request{
      {std::string(kUniqueIdentifierKey), plist::Value(identifier)},
      {"image-path", plist::Value(plist::Bytes(imagePath.begin(), imagePath.end()))}};
  if (verified) {
    request.set("image-device", plist::Value::UInt(verified->device));
    request.set("image-inode", plist::Value::UInt(verified->inode));
  }
  const std::string propertyList = plist::WriteXml(plist::Value(std::move(request)));

  registry::DeviceRegistry& registry = *CurrentServices().registry;
  auto services = registry.GetMatchingServices(registry::Matching::Class(std::string(kControllerClass)));
  if (!services.ok() || !services.value) {
    Log(Level::Default, "Could not lookup disk image kernel extension");
    return std::nullopt;
  }
  if (!services.value->IsValid()) services.value->Reset();
  const registry::ObjectRef controller = services.value->Next();
  if (!controller) {
    Log(Level::Default, "Failed to find disk image kernel extension.");
    return std::nullopt;
  }
  auto client = registry.Open(controller, 0);
  if (!client.ok() || !client.value) {
    Log(Level::Default, "Failed to connect to disk image kernel extension: 0x%04x",
        client.status & 0x3FFF);
    return std::nullopt;
  }
  const auto record = AttachRecord(propertyList);
  registry::MethodArgs args;
  args.structIn = record;
  args.structOutCapacity = kAttachOutputSize;
  if (const registry::Status status = client.value->CallMethod(kAttachSelector, args);
      status != registry::kSuccess) {
    Log(Level::Default, "Failed to attach disk image: 0x%04x", status & 0x3FFF);
    return std::nullopt;
  }
  return identifier;
}

std::optional<std::string> FindAttachedMedia(std::string_view uniqueIdentifier) {
  registry::DeviceRegistry& registry = *CurrentServices().registry;
  auto port = registry.CreateNotificationPort();
  if (!port.ok() || !port.value) {
    Log(Level::Default, "KxNotificationPortCreate failed.");
    return std::nullopt;
  }
  auto media = registry.AddMatchingNotification(*port.value, registry::MatchKind::Matched,
                                                registry::Matching::Class("KxMedia"), nullptr);
  if (!media.ok() || !media.value) {
    Log(Level::Default, "KxServiceAddMatchingNotification failed: 0x%04x", media.status & 0x3FFF);
    return std::nullopt;
  }
  const plist::Value wanted(uniqueIdentifier);
  std::optional<std::string> bsdName;
  while (const registry::ObjectRef object = media.value->Next()) {
    const auto identifier = registry::SearchProperty(object, kUniqueIdentifierKey);
    if (!identifier || !(*identifier == wanted)) continue;
    if (const auto name = object->Property("BSD Name"); name && name->string()) bsdName = *name->string();
  }
  return bsdName;
}

std::optional<std::string> AttachAndMountImage(std::string_view imagePath, std::string_view mountPath,
                                               const VerifiedFile* verified) {
  if (imagePath.empty() || mountPath.empty()) {
    Log(Level::Default, "Invalid inputs.");
    return std::nullopt;
  }
  if (IsUnsafePath(imagePath)) {
    Log(Level::Default, "Path is bad: %@", imagePath);
    return std::nullopt;
  }
  const std::optional<std::string> identifier = AttachDiskImage(imagePath, verified);
  if (!identifier) {
    Log(Level::Default, "Failed to attach %@.", imagePath);
    return std::nullopt;
  }
  const std::optional<std::string> bsdName = FindAttachedMedia(*identifier);
  if (!bsdName) {
    Log(Level::Default, "Failed to find the attached disk image.");
    return std::nullopt;
  }
  // A writer that opened or truncated the file since its digest began has broken the
  // lease: what was attached may not be what was verified.
  if (verified && !CurrentServices().os->HoldsReadLease(verified->fd)) {
    Log(Level::Default, "%@ was opened for writing after it was verified.", imagePath);
    EjectDevice(("/dev/" + *bsdName).c_str());
    return std::nullopt;
  }
  std::optional<std::string> deviceNode = MountImageVolume(*bsdName, mountPath);
  if (!deviceNode) {
    Log(Level::Default, "Failed to mount %@ on %@", imagePath, mountPath);
    // An image whose volume cannot be mounted is of no use attached; nothing else would
    // ever let it go. (After a version mismatch the volume mount has already let go,
    // and this second eject only logs that the device is free.)
    EjectDevice(("/dev/" + *bsdName).c_str());
    return std::nullopt;
  }
  return deviceNode;
}

}  // namespace brisvale
