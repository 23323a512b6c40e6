// Helpers shared by entering a sandbox root and tearing one down.
#pragma once

#include <dirent.h>
#include <linux/capability.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <initializer_list>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/linux/os_system.h"

namespace brisvale::linux_os::sandbox {

struct DirCloser {
  void operator()(DIR* dir) const { ::closedir(dir); }
};
using DirHandle = std::unique_ptr<DIR, DirCloser>;

inline bool Fail(std::string* error, std::string message) {
  if (error) *error = std::move(message);
  return false;
}

inline std::string SystemError(const std::string& what, int err) { return what + ": " + std::strerror(err); }

inline bool IsAtOrBelow(std::string_view path, std::string_view dir) {
  return path == dir || (path.size() > dir.size() && path.starts_with(dir) && path[dir.size()] == '/');
}

// The mounts as the kernel lists them, in mount order, paths uncut; empty when the
// table cannot be read.
inline std::vector<os::MountRecord> CurrentMounts() {
  std::vector<os::MountRecord> mounts;
  if (os::ReadWholeMountTable("/proc/self/mountinfo", mounts) < 0) mounts.clear();
  return mounts;
}

inline bool HasCapabilities(std::initializer_list<int> capabilities) {
  __user_cap_header_struct header{};
  header.version = _LINUX_CAPABILITY_VERSION_3;
  __user_cap_data_struct data[_LINUX_CAPABILITY_U32S_3]{};
  if (::syscall(SYS_capget, &header, data) != 0) return false;
  for (int cap : capabilities) {
    if (!(data[cap / 32].effective & (1u << (cap % 32)))) return false;
  }
  return true;
}

inline bool IsLoopName(std::string_view name) {
  if (!name.starts_with("loop") || name.size() == 4) return false;
  return std::all_of(name.begin() + 4, name.end(), [](char c) { return c >= '0' && c <= '9'; });
}

struct ResolvedDir {
  std::string path;
  bool exists = false;
};

// The absolute, link-free form of a sandbox directory, refusing "/" and non-directories.
inline std::optional<ResolvedDir> ResolveSandboxDir(const std::string& dir, bool missingIsFine,
                                                    std::string* error) {
  if (dir.empty()) {
    Fail(error, "no sandbox root directory given");
    return std::nullopt;
  }
  char buffer[PATH_MAX];
  if (!::realpath(dir.c_str(), buffer)) {
    if (errno == ENOENT && missingIsFine) return ResolvedDir{dir, false};
    Fail(error, SystemError("sandbox root " + dir, errno));
    return std::nullopt;
  }
  ResolvedDir resolved{buffer, true};
  struct stat st {};
  if (::stat(buffer, &st) != 0 || !S_ISDIR(st.st_mode)) {
    Fail(error, "sandbox root " + dir + " is not a directory");
    return std::nullopt;
  }
  if (resolved.path == "/") {
    Fail(error, "the sandbox root cannot be /");
    return std::nullopt;
  }
  return resolved;
}

}  // namespace brisvale::linux_os::sandbox
