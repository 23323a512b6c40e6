// Puts the daemon's localization bundle into a sandbox root. The English table is built
// into the binary from the same file `cmake --install` installs, so a root made here
// shows the same texts as an installed system.
#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>
#include <string_view>

#include "base/unique_fd.h"
#include "platform/linux/alert_linux.h"

namespace brisvale::alert {

extern const std::string_view kEnglishLocalizationStrings;

bool InstallLocalizationBundle(const std::string& root, std::string* error) {
  static constexpr const char* kDirectories[] = {
      "/System", "/System/Library", "/System/Library/PrivateFrameworks",
      "/System/Library/PrivateFrameworks/Brisvale.framework",
      "/System/Library/PrivateFrameworks/Brisvale.framework/en.lproj"};
  for (const char* directory : kDirectories) {
    std::string path = root + directory;
    if (mkdir(path.c_str(), 0755) != 0 && errno != EEXIST) {
      if (error) *error = path + ": " + std::strerror(errno);
      return false;
    }
  }
  std::string path = root + kDirectories[std::size(kDirectories) - 1] + "/Localization.strings";
  UniqueFd fd(open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0644));
  if (!fd) {
    if (errno == EEXIST) return true;  // a root keeps the table it has
    if (error) *error = path + ": " + std::strerror(errno);
    return false;
  }
  std::string_view text = kEnglishLocalizationStrings;
  while (!text.empty()) {
    ssize_t written = write(fd.get(), text.data(), text.size());
    if (written < 0 && errno == EINTR) continue;
    if (written <= 0) {
      if (error) *error = path + ": " + std::strerror(errno);
      return false;
    }
    text.remove_prefix(static_cast<size_t>(written));
  }
  return true;
}

}  // namespace brisvale::alert
