#include "diskimage/verified_mount.h"

#include <cstring>
#include <limits>
#include <vector>

#include "base/log.h"
#include "base/unique_fd.h"
#include "daemon/unmount.h"
#include "diskimage/mount_locations.h"
#include "diskimage/trust_cache.h"
#include "inventory/inventory.h"
#include "platform/os.h"
#include "platform/services.h"
#include "verify/container/qor4.h"
#include "verify/developer_signature.h"
#include "verify/image_digest.h"
#include "verify/personalized_manifest.h"

namespace brisvale {
namespace {

constexpr long kSha1Length = 20;
// Mount points under this prefix are fixed directories of the system image.
constexpr std::string_view kKeptMountPointPrefix = "/Developer";

// Removes the staged image when the attempt ends, whatever its outcome.
class ImageConsumer {
 public:
  explicit ImageConsumer(const std::string& path) : path_(path) {}
  ~ImageConsumer() {
    if (const int rc = CurrentServices().os->Unlink(path_.c_str()); rc < 0) {
      Log(Level::Default, "Failed to unlink %s: %{errno}d", path_.c_str(), -rc);
    }
  }
  ImageConsumer(const ImageConsumer&) = delete;
  ImageConsumer& operator=(const ImageConsumer&) = delete;

 private:
  const std::string& path_;
};

// Opens the file that lstat saw and pins it: the same inode, one link, and a read
// lease that no writer holds or breaks unnoticed. None after logging why.
std::optional<VerifiedFile> PinImageFile(const char* path, const os::FileStatus& seen, UniqueFd& fd) {
  os::Os& os = *CurrentServices().os;
  const int opened = os.OpenImageFile(path);
  if (opened < 0) {
    Log(Level::Default, "Failed to open %s for verification: %{errno}d", path, -opened);
    return std::nullopt;
  }
  fd = UniqueFd(opened);
  os::FileStatus status;
  if (const int rc = os.StatDescriptor(fd.get(), status); rc < 0) {
    Log(Level::Default, "Failed to stat %s: %{errno}d", path, -rc);
    return std::nullopt;
  }
  if (status.device != seen.device || status.inode != seen.inode ||
      (status.mode & os::kFileTypeMask) != os::kFileTypeRegular) {
    Log(Level::Default, "%s was replaced while it was opened.", path);
    return std::nullopt;
  }
  if (status.linkCount != 1) {
    Log(Level::Default, "%s has %llu links; only a file with one link is mounted.", path,
        static_cast<unsigned long long>(status.linkCount));
    return std::nullopt;
  }
  if (const int rc = os.TakeReadLease(fd.get()); rc < 0) {
    Log(Level::Default, "Failed to take a read lease on %s: %{errno}d", path, -rc);
    return std::nullopt;
  }
  return VerifiedFile{fd.get(), status.device, status.inode};
}

// The digest the signature or manifest vouches for, checked against them. The
// personalized sub-type is set for log lines.
std::optional<plist::Bytes> VerifyImage(const VerifiedMountRequest& request, const VerifiedFile& file,
                                        const MountSteps& steps, std::string& subType) {
  std::vector<uint8_t> digest;
  if (request.diskImageType == "Personalized") {
    const std::optional<std::span<const uint8_t>> vouched =
        CopyManifestImageProperty(request.imageSignature, Qor4Code("DGST"));
    if (!vouched) return std::nullopt;
    std::optional<std::string> name = CopyPersonalizedSubType(request.imageSignature);
    if (!name) return std::nullopt;
    subType = std::move(*name);
    const long digestLength = static_cast<long>(vouched->size());
    if (verify::DigestImageDescriptor(file.fd, request.imagePath, &digest, digestLength) != 0) {
      Log(Level::Default, "Failed to digest %@.", request.imagePath);
      return std::nullopt;
    }
    if (steps.checkSignature(request, digest) != 0) {
      Log(Level::Default, "Failed to validate server ticket with this device/image");
      return std::nullopt;
    }
    return digest;
  }
  if (verify::DigestImageDescriptor(file.fd, request.imagePath, &digest, kSha1Length) != 0) {
    Log(Level::Default, "Failed to digest %@.", request.imagePath);
    return std::nullopt;
  }
  if (steps.checkSignature(request, digest) != 0) {
    Log(Level::Default, "Failed to verify the disk image signature.");
    return std::nullopt;
  }
  return digest;
}

// The mount path of an image of the same type with this digest, if one is mounted.
std::optional<std::string> FindIdenticalImage(std::string_view diskImageType, const plist::Bytes& digest) {
  const std::optional<plist::Array> entries = CopyDiskImageEntriesOfType(diskImageType);
  if (!entries) return std::nullopt;
  const plist::Value wanted(digest);
  for (const plist::Value& entry : *entries) {
    const plist::Value* signature = entry.get("ImageSignature");
    const std::string* mountPath = entry.getString("MountPath");
    if (signature && *signature == wanted && mountPath) return *mountPath;
  }
  return std::nullopt;
}

// Takes a just-mounted image away again: unmount, its directory, its device.
void UndoMount(const std::string& mountPath, const std::string& deviceNode) {
  os::Os& os = *CurrentServices().os;
  if (const int rc = os.Unmount(mountPath.c_str(), /*force=*/true); rc < 0) {
    Log(Level::Default, "Failed to force unmount %@: %s", mountPath, std::strerror(-rc));
  }
  if (!std::string_view(mountPath).starts_with(kKeptMountPointPrefix)) {
    if (const int rc = os.RemoveDirectory(mountPath.c_str()); rc < 0) {
      Log(Level::Default, "Failed to remove %@: %s", mountPath, std::strerror(-rc));
    }
  }
  EjectDevice(deviceNode.c_str());
}

}  // namespace

MountSteps DefaultMountSteps() {
  return MountSteps{
      [](const VerifiedMountRequest& request, std::span<const uint8_t> digest) {
        if (request.diskImageType == "Personalized") {
          return verify::VerifyPersonalizedManifest(request.imageSignature, digest);
        }
        return verify::VerifyDeveloperImageSignature(
            request.imageSignature, request.certificatePath.value_or(std::string_view()), digest);
      },
      [](std::string_view imagePath, std::string_view mountPath, const VerifiedFile& verified) {
        return AttachAndMountImage(imagePath, mountPath, &verified);
      },
      [](std::string_view mountPath) { return LoadTrustCache(mountPath); }};
}

VerifiedMountResult MountVerifiedImage(MatchingContext&, const VerifiedMountRequest& request,
                                       const MountSteps& steps) {
  VerifiedMountResult result;
  if (request.imagePath.empty() || request.diskImageType.empty() || request.mountPath.empty()) {
    Log(Level::Default, "Invalid inputs.");
    return result;
  }
  if (request.imagePath.size() > kMaxImagePathLength) {
    Log(Level::Default, "Failed to create string.");
    return result;
  }
  const std::string imagePath(request.imagePath);
  const char* path = imagePath.c_str();
  const ImageConsumer consumer(imagePath);

  os::FileStatus seen;
  if (const int rc = CurrentServices().os->StatPath(path, seen); rc < 0) {
    Log(Level::Default, "Failed to lstat %s: %{errno}d", path, -rc);
    return result;
  }
  if ((seen.mode & os::kFileTypeMask) != os::kFileTypeRegular) {
    Log(Level::Default, "%s is not a regular file (mode: 0x%04x).", path, seen.mode & os::kFileTypeMask);
    return result;
  }
  // Held until the attach has been checked; closing it ends the lease.
  UniqueFd imageFd;
  const std::optional<VerifiedFile> file = PinImageFile(path, seen, imageFd);
  if (!file) return result;

  std::string subType;
  result.imageDigest = VerifyImage(request, *file, steps, subType);
  if (!result.imageDigest) return result;

  result.existingMountPath = FindIdenticalImage(request.diskImageType, *result.imageDigest);
  if (result.existingMountPath) {
    Log(Level::Default, "Matching image of type %@/%s found.", request.diskImageType,
        subType.empty() ? "(null)" : subType.c_str());
    return result;
  }
  const std::string mountPath(request.mountPath);
  if (ValidateMountPoint(mountPath) != 0) {
    Log(Level::Default, "Failed to verify the disk image mount path %@.", mountPath);
    return result;
  }
  if (IsUnsafePath(imagePath)) {
    Log(Level::Default, "Disk image path is bad: %@", imagePath);
    return result;
  }
  std::optional<std::string> deviceNode = steps.attachAndMount(imagePath, mountPath, *file);
  if (!deviceNode) {
    Log(Level::Default, "Failed to mount %@ at %@.", imagePath, mountPath);
    return result;
  }
  if (steps.loadTrustCache(mountPath) != 0) {
    Log(Level::Default, "Failed to load trust caches at %@.", mountPath);
    UndoMount(mountPath, *deviceNode);
    return result;
  }
  Log(Level::Default, "Successfully mounted %@", mountPath);
  result.deviceNode = std::move(deviceNode);
  return result;
}

}  // namespace brisvale
