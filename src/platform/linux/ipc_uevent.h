// Kernel device events (the netlink uevent datagrams of the kernel group) translated
// into the hardware events the daemon's matching stream carries. No udevd runs on the
// machines this serves, so the kernel's own messages are the source.
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>

namespace brisvale::ipc {

inline constexpr char kMatchingStream[] = "com.vantrel.kestrix.matching";
inline constexpr char kMediaAttachedEvent[] = "com.vantrel.brisvale_mounter.attached";
inline constexpr char kMediaDetachedEvent[] = "com.vantrel.brisvale_mounter.detached";
inline constexpr char kCameraEvent[] = "com.vantrel.mobile.ptp_camera";

// The matching-stream event name for one uevent datagram: block add/change -> attached,
// block remove -> detached, a USB still-image interface (6/1/1) added -> camera.
// None for everything else, including malformed datagrams.
std::optional<std::string> MatchingEventForUevent(std::span<const uint8_t> datagram);

}  // namespace brisvale::ipc
