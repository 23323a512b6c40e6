// The Linux user-alert service: alerts go to an agent listening on a Unix stream socket
// (a UI shell, or `brisvalectl alert-agent` on a console); preferences are property-list
// files under /var/<user>/Library/Preferences; bundles are directories whose string
// tables are property lists at en.lproj/<table>.strings.
#pragma once

#include <memory>
#include <string>

#include "platform/linux/alert_protocol.h"
#include "platform/user_alert.h"

namespace brisvale::alert {

struct LinuxAlertOptions {
  std::string agentSocketPath = kAlertAgentSocketPath;
  // Prefixed to every preference file and bundle path; tests point it at a scratch root.
  std::string root;
};

std::unique_ptr<UserAlertService> CreateLinuxUserAlertService(RunLoop& loop,
                                                              LinuxAlertOptions options = {});

// The path of the preference file of `domain` for `user`; none when either name could
// leave the preferences directory.
std::optional<std::string> PreferenceFilePath(std::string_view domain, std::string_view user);

// Writes the English string table of the daemon's localization bundle below `root`
// unless one is there already, so that a sandbox root has the bundle the system would.
bool InstallLocalizationBundle(const std::string& root, std::string* error);

}  // namespace brisvale::alert
