// Mounting the volume of an attached disk image read-only, and the check that the
// image was built for the running system's major.minor version.
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <span>
#include <string>
#include <string_view>

namespace brisvale {

// The running system's version file; an image carries its own copy at the same path
// below its mount point.
inline constexpr std::string_view kSystemVersionPath = "/System/Library/Basalt/SystemVersion.plist";

// The text encoding value that means "none chosen".
inline constexpr uint32_t kNoTextEncoding = 0xFFFFFFFF;

// Mounts the medium `bsdName` ("loop3") read-only at `mountPath` and, outside the
// personalized roots, checks its system version (undoing the mount and the attach when
// it does not match). Answers the device node ("/dev/loop3"), or none.
std::optional<std::string> MountImageVolume(std::string_view bsdName, std::string_view mountPath);

// True when the image mounted at `mountPath` carries the running system's major and
// minor version, each compared as text.
bool VerifySystemVersion(std::string_view mountPath);

// Where the encoding of an HFS-wrapped volume comes from when its master directory
// block gives no hint. Each source is asked only when the choice gets that far.
struct TextEncodingSources {
  // The HFS file system's encoding bias; -1 when it cannot be asked.
  std::function<int32_t()> encodingBias;
  // The contents of user 0's text-encoding file, none when it has none.
  std::function<std::optional<std::string>()> userTextEncoding;
};

// The text encoding to mount with, from the 512-byte master directory block read at
// byte 1024 of the device (shorter when the read fell short).
uint32_t ChooseTextEncoding(std::span<const uint8_t> masterDirectoryBlock,
                            const TextEncodingSources& sources);

}  // namespace brisvale
