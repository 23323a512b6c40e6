// The sandbox root: running the daemon chrooted in a directory that looks like a
// device (a /dev of its own, /proc, /sys and /usr from the host, /var a link to
// private/var), and taking such a directory apart again. There is no new mount
// namespace, so whatever is mounted under the directory, inside or outside, is seen on
// both sides and outlives the daemon, as mounts on a device do.
//
// Also the start-up check of the host's layout for a daemon that runs without one.
#pragma once

#include <string>

namespace brisvale::linux_os {

// Builds (or reuses) the sandbox in `dir`, then chroots into it and changes to "/".
// Needs CAP_SYS_ADMIN, CAP_MKNOD and CAP_SYS_CHROOT. Bad input or missing privileges
// fail before anything is created; a failure later leaves a sandbox that a second call
// completes. The helper mounts of /proc, /sys and /usr are made once: a restart finds
// and reuses them.
bool EnterSandboxRoot(const std::string& dir, std::string* error);

// Unmounts everything at or below `dir` (deepest first), detaches the loop devices
// whose backing files lie in it and removes it. Never follows a link and never
// descends into a mount, so nothing outside `dir` is touched. Refuses a directory that
// EnterSandboxRoot did not build. A `dir` that no longer exists is already torn down.
bool TeardownSandboxRoot(const std::string& dir, std::string* error);

// The daemon's mount roots live under /private/var and are reached through /var: it
// refuses to start unless /var resolves to /private/var.
bool CheckFilesystemLayout(std::string* error);

// The file EnterSandboxRoot leaves in the root, by which teardown knows the directory.
inline constexpr const char* kSandboxMarker = ".brisvale-sandbox-root";

}  // namespace brisvale::linux_os
