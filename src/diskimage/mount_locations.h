// Where each kind of disk image is mounted, and the checks that a mount directory is
// usable and that an image path is canonical and free of symbolic links.
#pragma once

#include <optional>
#include <span>
#include <string>
#include <string_view>

namespace brisvale {

// Longest path, in bytes, the disk-image code handles.
inline constexpr size_t kMaxImagePathLength = 1024;

// Where one request's image goes and how it is announced.
struct MountLocation {
  std::string mountPath;                       // absolute, no trailing "/"
  std::optional<std::string> subType;          // the manifest's sub-type, personalized only
  std::optional<std::string> certificatePath;  // developer and factory images only
  std::string typeNotification;
};

// The mount location for `diskImageType`; a personalized image's sub-type comes from
// its manifest `imageSignature`. Creates the directory where the type calls for a new
// one. None after logging why.
std::optional<MountLocation> ResolveMountLocation(std::string_view diskImageType,
                                                  std::span<const uint8_t> imageSignature);

// Property `tag` of the "pdmg" object of a personalized manifest, pointing into
// `manifest`; none after logging why.
std::optional<std::span<const uint8_t>> CopyManifestImageProperty(std::span<const uint8_t> manifest,
                                                                  uint32_t tag);

// The sub-type ("pdnm" of the "pdmg" object) of a personalized manifest, or none after
// logging why.
std::optional<std::string> CopyPersonalizedSubType(std::span<const uint8_t> manifest);

// 0 when `mountPath` is an empty directory (made when it is a missing creatable root);
// -1 after logging why.
int ValidateMountPoint(std::string_view mountPath);

// True when `path` is too long, not canonical, missing or reached through a link.
bool IsUnsafePath(std::string_view path);
// True when `path` or any directory above it is a symbolic link.
bool HasSymbolicLinkInPath(std::string_view path);

}  // namespace brisvale
