// Mounting the volume of an attached disk image read-only, and the check that the
// image was built for the running system's major.minor version.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "diskimage/text_encoding.h"

namespace brisvale {

// The running system's version file; an image carries its own copy at the same path
// below its mount point.
inline constexpr std::string_view kSystemVersionPath = "/System/Library/Basalt/SystemVersion.plist";

// Mounts the medium `bsdName` ("loop3") read-only at `mountPath` and, outside the
// personalized roots, checks its system version (undoing the mount and the attach when
// it does not match). Answers the device node ("/dev/loop3"), or none.
std::optional<std::string> MountImageVolume(std::string_view bsdName, std::string_view mountPath);

// True when the image mounted at `mountPath` carries the running system's major and
// minor version, each compared as text.
bool VerifySystemVersion(std::string_view mountPath);

}  // namespace brisvale
