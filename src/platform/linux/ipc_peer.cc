#include "platform/linux/ipc_peer.h"

#include <errno.h>
#include <limits.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/xattr.h>
#include <unistd.h>

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
  return identity;
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
  if (length <= 0 || !StillRunning()) return std::nullopt;
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
