#include "platform/linux/ipc_socket.h"

#include <errno.h>
#include <fcntl.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <charconv>
#include <optional>

namespace brisvale::ipc {
namespace {

constexpr int kFirstActivatedFd = 3;

std::string ErrnoText(int error) { return strerror(error); }

std::optional<sockaddr_un> UnixAddress(std::string_view path, std::string* error) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.empty() || path.size() >= sizeof(address.sun_path)) {
    if (error) *error = "socket path \"" + std::string(path) + "\" is empty or too long";
    return std::nullopt;
  }
  path.copy(address.sun_path, path.size());
  return address;
}

// mkdir -p with mode 0755 for every directory created.
bool MakeDirectories(const std::string& directory, std::string* error) {
  if (directory.empty()) return true;
  for (size_t slash = directory.find('/', 1);; slash = directory.find('/', slash + 1)) {
    const std::string prefix = directory.substr(0, slash);
    if (mkdir(prefix.c_str(), 0755) == 0) {
      chmod(prefix.c_str(), 0755);  // the umask may have narrowed it
    } else if (errno != EEXIST) {
      if (error) *error = "cannot create " + prefix + ": " + ErrnoText(errno);
      return false;
    }
    if (slash == std::string::npos) return true;
  }
}

// True when a process is accepting connections on the socket at `address`.
bool SomeoneListens(const sockaddr_un& address) {
  UniqueFd probe(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  if (!probe) return false;
  const int result = connect(probe.get(), reinterpret_cast<const sockaddr*>(&address), sizeof(address));
  // A full backlog (EAGAIN) still means a live listener.
  return result == 0 || errno == EAGAIN;
}

bool IsListeningUnixStream(int fd) {
  int value = 0;
  socklen_t length = sizeof(value);
  if (getsockopt(fd, SOL_SOCKET, SO_ACCEPTCONN, &value, &length) != 0 || value == 0) return false;
  length = sizeof(value);
  if (getsockopt(fd, SOL_SOCKET, SO_TYPE, &value, &length) != 0 || value != SOCK_STREAM) return false;
  length = sizeof(value);
  if (getsockopt(fd, SOL_SOCKET, SO_DOMAIN, &value, &length) != 0 || value != AF_UNIX) return false;
  return true;
}

std::optional<long> ParseNumber(const char* text) {
  if (!text) return std::nullopt;
  long value = 0;
  const char* end = text + strlen(text);
  auto [ptr, ec] = std::from_chars(text, end, value);
  if (ec != std::errc() || ptr != end) return std::nullopt;
  return value;
}

}  // namespace

UniqueFd ListenOnPath(const std::string& path, std::string* error) {
  std::optional<sockaddr_un> address = UnixAddress(path, error);
  if (!address) return {};
  const size_t slash = path.rfind('/');
  if (slash != std::string::npos && slash > 0 && !MakeDirectories(path.substr(0, slash), error)) {
    return {};
  }

  struct stat existing {};
  if (lstat(path.c_str(), &existing) == 0) {
    if (!S_ISSOCK(existing.st_mode)) {
      if (error) *error = path + " exists and is not a socket";
      return {};
    }
    if (SomeoneListens(*address)) {
      if (error) *error = path + " is already served by another process";
      return {};
    }
    unlink(path.c_str());
  }

  UniqueFd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  if (!fd) {
    if (error) *error = "socket: " + ErrnoText(errno);
    return {};
  }
  if (bind(fd.get(), reinterpret_cast<const sockaddr*>(&*address), sizeof(*address)) != 0) {
    if (error) *error = "cannot bind " + path + ": " + ErrnoText(errno);
    return {};
  }
  if (chmod(path.c_str(), 0666) != 0 || listen(fd.get(), SOMAXCONN) != 0) {
    if (error) *error = "cannot listen on " + path + ": " + ErrnoText(errno);
    unlink(path.c_str());
    return {};
  }
  return fd;
}

std::vector<ActivatedSocket> TakeActivatedSockets() {
  std::vector<ActivatedSocket> sockets;
  const std::optional<long> pid = ParseNumber(getenv("LISTEN_PID"));
  const std::optional<long> count = ParseNumber(getenv("LISTEN_FDS"));
  if (!pid || *pid != getpid() || !count || *count < 1) return sockets;

  std::vector<std::string> names;
  if (const char* list = getenv("LISTEN_FDNAMES")) {
    std::string_view rest(list);
    while (!rest.empty()) {
      const size_t colon = rest.find(':');
      names.emplace_back(rest.substr(0, colon));
      rest = colon == std::string_view::npos ? std::string_view() : rest.substr(colon + 1);
    }
  }
  unsetenv("LISTEN_PID");
  unsetenv("LISTEN_FDS");
  unsetenv("LISTEN_FDNAMES");

  for (long i = 0; i < *count && i < 64; ++i) {
    std::string name = static_cast<size_t>(i) < names.size() ? names[i] : std::string();
    const int fd = kFirstActivatedFd + static_cast<int>(i);
    if (!IsListeningUnixStream(fd)) continue;
    fcntl(fd, F_SETFD, FD_CLOEXEC);
    fcntl(fd, F_SETFL, fcntl(fd, F_GETFL) | O_NONBLOCK);
    sockets.push_back({UniqueFd(fd), std::move(name)});
  }
  return sockets;
}

UniqueFd ConnectToPath(std::string_view path, std::string* error) {
  std::optional<sockaddr_un> address = UnixAddress(path, error);
  if (!address) return {};
  UniqueFd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  if (!fd) {
    if (error) *error = "socket: " + ErrnoText(errno);
    return {};
  }
  int result;
  do {
    result = connect(fd.get(), reinterpret_cast<const sockaddr*>(&*address), sizeof(*address));
  } while (result != 0 && errno == EINTR);
  if (result != 0) {
    if (error) *error = "cannot connect to " + std::string(path) + ": " + ErrnoText(errno);
    return {};
  }
  fcntl(fd.get(), F_SETFL, fcntl(fd.get(), F_GETFL) | O_NONBLOCK);
  return fd;
}

}  // namespace brisvale::ipc
