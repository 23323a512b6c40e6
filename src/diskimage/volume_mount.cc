#include "diskimage/volume_mount.h"

#include <algorithm>
#include <array>
#include <vector>

#include "base/log.h"
#include "base/plist.h"
#include "daemon/unmount.h"
#include "platform/os.h"
#include "platform/services.h"

namespace brisvale {
namespace {

// The HFS master directory block is read at byte 1024 of the device.
constexpr size_t kMasterDirectoryBlockOffset = 1024;
constexpr size_t kMasterDirectoryBlockSize = 512;

// Mount points under these roots hold personalized images, which carry no system
// version of their own.
constexpr std::string_view kUncheckedRoots[] = {
    "/private/var/personalized_automation",
    "/private/var/personalized_debug",
    "/private/var/personalized_demo",
    "/private/var/personalized_factory",
};

constexpr size_t kVersionFileLimit = 1 << 20;

// "ProductVersion" of the version file at `path`, split at its dots; none when the file,
// the key or a second component is missing.
std::optional<std::vector<std::string>> ReadProductVersion(const std::string& path) {
  std::vector<uint8_t> contents;
  if (CurrentServices().os->ReadFile(path.c_str(), kVersionFileLimit, contents) < 0) return std::nullopt;
  const std::optional<plist::Value> root = plist::Read(contents);
  const std::string* version = root ? root->getString("ProductVersion") : nullptr;
  if (!version) return std::nullopt;
  std::vector<std::string> components;
  for (size_t start = 0;;) {
    const size_t dot = version->find('.', start);
    components.push_back(version->substr(start, dot - start));
    if (dot == std::string::npos) break;
    start = dot + 1;
  }
  // Major and minor are compared; a version without both cannot be checked.
  if (components.size() < 2) return std::nullopt;
  return components;
}

int32_t AskEncodingBias() {
  int32_t bias = -1;
  return CurrentServices().os->EncodingBias("hfs", bias) < 0 ? -1 : bias;
}

std::optional<std::string> ReadUserTextEncoding() {
  os::Os& os = *CurrentServices().os;
  std::string home;
  if (os.UserHomeDirectory(0, home) < 0) return std::nullopt;
  std::vector<uint8_t> contents;
  if (os.ReadFile((home + "/.ZxUserTextEncoding").c_str(), os::kPathBufferSize - 1, contents) < 0) {
    return std::nullopt;
  }
  return std::string(contents.begin(), contents.end());
}

}  // namespace

std::optional<std::string> MountImageVolume(std::string_view bsdName, std::string_view mountPath) {
  if (bsdName.empty() || mountPath.empty()) {
    Log(Level::Default, "Invalid inputs.");
    return std::nullopt;
  }
  const std::string devicePath = "/dev/" + std::string(bsdName);
  if (bsdName.size() >= os::kPathBufferSize || devicePath.size() >= os::kPathBufferSize ||
      mountPath.size() >= os::kPathBufferSize) {
    Log(Level::Default, "Failed to create string.");
    return std::nullopt;
  }
  const std::string mountPoint(mountPath);
  const uint32_t flags = mountPoint == "/" ? os::kMountReadOnly | os::kMountUnion : os::kMountReadOnly;

  os::Os& os = *CurrentServices().os;
  os::VolumeMountArguments arguments;
  arguments.devicePath = devicePath;
  // An unreadable master directory block is no error: the encoding stays unchosen.
  std::array<uint8_t, os::kVolumeHeaderLength> header{};
  if (os.ReadVolumeHeader(devicePath.c_str(), header).outcome == os::VolumeHeaderRead::Outcome::Read) {
    arguments.textEncoding = ChooseTextEncoding(
        std::span(header).subspan(kMasterDirectoryBlockOffset, kMasterDirectoryBlockSize),
        {AskEncodingBias, ReadUserTextEncoding});
  }
  if (const int rc = os.MountVolume("hfs", mountPoint.c_str(), flags, arguments); rc < 0) {
    Log(Level::Default, "Failed to mount %s on %s: %{errno}d", devicePath, mountPoint, -rc);
    return std::nullopt;
  }

  const bool unchecked = std::any_of(std::begin(kUncheckedRoots), std::end(kUncheckedRoots),
                                     [&](std::string_view root) { return mountPath.starts_with(root); });
  if (!unchecked && !VerifySystemVersion(mountPath)) {
    Log(Level::Default, "System version verification failed for %@.", mountPath);
    os.Unmount(mountPoint.c_str(), true);
    EjectDevice(devicePath.c_str());
    return std::nullopt;
  }
  return devicePath;
}

bool VerifySystemVersion(std::string_view mountPath) {
  const auto image = ReadProductVersion(std::string(mountPath) + std::string(kSystemVersionPath));
  if (!image) {
    Log(Level::Default, "Failed to retrieve disk image product version from %s.", kSystemVersionPath);
    return false;
  }
  Log(Level::Info, "Disk Image Product Version: %@.%@", (*image)[0], (*image)[1]);
  const auto system = ReadProductVersion(std::string(kSystemVersionPath));
  if (!system) {
    Log(Level::Default, "Failed to retrieve system product version from %s.", kSystemVersionPath);
    return false;
  }
  Log(Level::Info, "System Product Version: %@.%@", (*system)[0], (*system)[1]);
  if ((*image)[0] == (*system)[0] && (*image)[1] == (*system)[1]) return true;
  Log(Level::Default, "System Version Mismatch for %@: (System: %@.%@ / Image: %@.%@)", mountPath,
      (*system)[0], (*system)[1], (*image)[0], (*image)[1]);
  return false;
}

}  // namespace brisvale
