// Removable media in a sandbox root: the check and mount tool doubles at the sandbox's
// /sbin and simulated volumes at its /dev, from scripts/doubles (which the demo uses too).
#pragma once

#include <string>

#include "sandbox_daemon.h"

namespace brisvale::testing {

// Copies the fsck_hfs and mount_hfs doubles to the sandbox's /sbin.
bool InstallToolDoubles(const SandboxDaemon& daemon);

// Writes the simulated medium /dev/`bsdName`: `kind` is hfs+, hfsx, fat, exfat or ntfs;
// `marker` ("dirty", "broken", "hang" or empty) tells the checker double what to answer.
bool PlaceVolume(const SandboxDaemon& daemon, const std::string& bsdName, const std::string& kind,
                 const std::string& marker = "");

}  // namespace brisvale::testing
