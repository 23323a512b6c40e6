#include "platform/linux/ipc_peer.h"

#include <errno.h>
#include <limits.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cstdlib>
#include <fstream>
#include <iterator>
#include <sstream>
#include <vector>

#include "base/log.h"

// Newer than the installed kernel headers; the kernel answers ENOPROTOOPT where it
// does not know the option.
#ifndef SO_PEERPIDFD
#define SO_PEERPIDFD 77
#endif

namespace brisvale::ipc {
namespace {

// Extended attributes cannot be larger than this on Linux.
constexpr size_t kMaxAttributeSize = 64 * 1024;

std::string ProcExePath(pid_t pid) { return "/proc/" + std::to_string(pid) + "/exe"; }

int OpenPidfd(pid_t pid) { return static_cast<int>(syscall(SYS_pidfd_open, pid, 0)); }

}  // namespace

PeerIdentity PeerIdentity::FromSocket(int fd) {
  PeerIdentity identity;
  ucred credentials{};
  socklen_t length = sizeof(credentials);
  if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &credentials, &length) != 0) {
    Log(Level::Default, "Cannot read peer credentials: %{errno}d", errno);
    return identity;
  }
  identity.pid_ = credentials.pid;
  identity.uid_ = credentials.uid;

  int pidfd = -1;
  length = sizeof(pidfd);
  if (getsockopt(fd, SOL_SOCKET, SO_PEERPIDFD, &pidfd, &length) == 0) {
    identity.pidfd_.Reset(pidfd);
  } else if (errno == ENOPROTOOPT && credentials.pid > 0) {
    // An older kernel: the pid is taken now, which leaves only the short window between
    // the peer's connect and this accept for a pid to be reused.
    identity.pidfd_.Reset(OpenPidfd(credentials.pid));
  }
  // Taken while the pidfd says the caller still runs, so it describes the caller.
  std::optional<Image> image = ReadImage(credentials.pid);
  if (identity.StillRunning()) identity.image_ = image;
  return identity;
}

// Linux cannot tie a request to the program that made it beyond this: a process may
// hand its connection to another (descriptor passing) or be driven by a debugger of
// its own user, an executable's inode number can come back once the file is deleted,
// and a process with CAP_SYS_RESOURCE can change the file /proc/<pid>/exe names. What
// it does catch is the common case: an exec into another program, and a pid that now
// names a different process (another start time).
std::optional<PeerIdentity::Image> PeerIdentity::ReadImage(pid_t pid) {
  if (pid <= 0) return std::nullopt;
  struct stat executable {};
  if (stat(ProcExePath(pid).c_str(), &executable) != 0) return std::nullopt;
  std::ifstream statFile("/proc/" + std::to_string(pid) + "/stat");
  std::string stat((std::istreambuf_iterator<char>(statFile)), std::istreambuf_iterator<char>());
  // The command name (field 2) may hold spaces and parentheses: count from its end.
  const size_t nameEnd = stat.rfind(')');
  if (nameEnd == std::string::npos) return std::nullopt;
  std::istringstream fields(stat.substr(nameEnd + 1));
  std::string field;
  for (int index = 3; index <= 22 && fields >> field; ++index) {
    if (index == 22) {
      return Image{static_cast<uint64_t>(executable.st_dev), static_cast<uint64_t>(executable.st_ino),
                   std::strtoull(field.c_str(), nullptr, 10)};
    }
  }
  return std::nullopt;
}

bool PeerIdentity::StillRunning() const {
  if (!pidfd_) return false;
  // A pidfd becomes readable once its process has exited.
  pollfd entry{pidfd_.get(), POLLIN, 0};
  const int ready = poll(&entry, 1, 0);
  return ready == 0;
}

std::string PeerIdentity::ExecutablePath() const {
  if (pid_ <= 0) return {};
  std::vector<char> buffer(PATH_MAX + 1);
  const ssize_t length = readlink(ProcExePath(pid_).c_str(), buffer.data(), buffer.size() - 1);
  if (length <= 0 || !StillRunning()) return {};
  return std::string(buffer.data(), static_cast<size_t>(length));
}

std::optional<plist::Dictionary> PeerIdentity::Entitlements() const {
  if (pid_ <= 0) return std::nullopt;
  const std::string exe = ProcExePath(pid_);
  std::vector<uint8_t> bytes(kMaxAttributeSize);
  const ssize_t length = getxattr(exe.c_str(), kEntitlementsAttribute, bytes.data(), bytes.size());
  if (length <= 0) return std::nullopt;
  // Read after the attribute: an exec before or during the read shows here.
  if (!image_ || ReadImage(pid_) != image_ || !StillRunning()) {
    Log(Level::Default, "Serving pid %d without entitlements: it no longer runs the program that connected",
        static_cast<int>(pid_));
    return std::nullopt;
  }
  bytes.resize(static_cast<size_t>(length));

  std::string error;
  std::optional<plist::Value> value = plist::Read(bytes, &error);
  if (!value || !value->dictionary()) {
    Log(Level::Default, "Ignoring malformed entitlements of pid %d: %s", static_cast<int>(pid_),
        error.empty() ? std::string("not a dictionary") : error);
    return std::nullopt;
  }
  return *value->dictionary();
}

}  // namespace brisvale::ipc
