// Entering a sandbox root: building (or completing) the device-like tree and
// chrooting into it; and the host layout check for a daemon that runs without one.
#include <fcntl.h>
#include <sys/mount.h>
#include <sys/statvfs.h>
#include <sys/sysmacros.h>

#include <utility>

#include "base/unique_fd.h"
#include "platform/linux/os_sandbox.h"
#include "platform/linux/os_sandbox_internal.h"

namespace brisvale::linux_os {
namespace {

using namespace sandbox;
using Fd = UniqueFd;

// Building blocks of the tree; every one keeps what is already right.

// Opens `name` under `parent` as a directory, creating it with `mode` when missing.
// A link in its place is refused, never followed.
std::optional<Fd> EnsureDirectory(int parent, const std::string& name, mode_t mode,
                                  const std::string& shownPath, std::string* error) {
  if (::mkdirat(parent, name.c_str(), mode) == 0) {
    ::fchmodat(parent, name.c_str(), mode, 0);  // the umask must not narrow /tmp's 1777
  } else if (errno != EEXIST) {
    Fail(error, SystemError("cannot create " + shownPath, errno));
    return std::nullopt;
  }
  Fd fd(::openat(parent, name.c_str(), O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC | O_RDONLY));
  if (!fd) {
    Fail(error, errno == ELOOP || errno == ENOTDIR ? shownPath + " exists and is not a directory"
                                                   : SystemError("cannot open " + shownPath, errno));
    return std::nullopt;
  }
  return fd;
}

bool EnsureLink(int parent, const std::string& name, const std::string& target,
                const std::string& shownPath, std::string* error) {
  char current[PATH_MAX];
  ssize_t n = ::readlinkat(parent, name.c_str(), current, sizeof current - 1);
  if (n >= 0) {
    if (std::string_view(current, static_cast<size_t>(n)) == target) return true;
    return Fail(error, shownPath + " is a link to " + std::string(current, static_cast<size_t>(n)) +
                           ", expected " + target);
  }
  if (errno == EINVAL) return Fail(error, shownPath + " exists and is not a link to " + target);
  if (errno != ENOENT) return Fail(error, SystemError("cannot read " + shownPath, errno));
  if (::symlinkat(target.c_str(), parent, name.c_str()) != 0) {
    return Fail(error, SystemError("cannot create link " + shownPath, errno));
  }
  return true;
}

// Makes `name` a device node of the given type and number; anything else in its place
// (a stale node, a plain file) is replaced, a directory is refused.
bool EnsureNode(int devFd, const std::string& name, mode_t type, dev_t rdev, mode_t perms,
                const std::string& shownPath, std::string* error) {
  struct stat st {};
  if (::fstatat(devFd, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0) {
    if ((st.st_mode & S_IFMT) == type && st.st_rdev == rdev) return true;
    if (S_ISDIR(st.st_mode)) return Fail(error, shownPath + " is a directory, not a device node");
    if (::unlinkat(devFd, name.c_str(), 0) != 0) {
      return Fail(error, SystemError("cannot replace " + shownPath, errno));
    }
  }
  if (::mknodat(devFd, name.c_str(), type | perms, rdev) != 0) {
    return Fail(error, SystemError("cannot create device node " + shownPath, errno));
  }
  ::fchmodat(devFd, name.c_str(), perms, 0);
  return true;
}

struct StandardNode {
  const char* name;
  unsigned major;
  unsigned minor;
  mode_t perms;
};
constexpr StandardNode kStandardNodes[] = {
    {"null", 1, 3, 0666},   {"zero", 1, 5, 0666}, {"full", 1, 7, 0666},
    {"random", 1, 8, 0666}, {"urandom", 1, 9, 0666}, {"tty", 5, 0, 0666},
    {"loop-control", 10, 237, 0660},
};

bool BuildDeviceRoot(int rootFd, const std::string& root, std::string* error) {
  std::string devPath = root + "/dev";
  auto dev = EnsureDirectory(rootFd, "dev", 0755, devPath, error);
  if (!dev) return false;
  for (const StandardNode& node : kStandardNodes) {
    // The host's numbers where it has the node (they are fixed on Linux in practice).
    dev_t rdev = makedev(node.major, node.minor);
    struct stat host {};
    if (::stat(("/dev/" + std::string(node.name)).c_str(), &host) == 0 && S_ISCHR(host.st_mode)) {
      rdev = host.st_rdev;
    }
    if (!EnsureNode(dev->get(), node.name, S_IFCHR, rdev, node.perms, devPath + "/" + node.name, error)) {
      return false;
    }
  }
  DirHandle hostDev(::opendir("/dev"));
  if (hostDev) {
    while (dirent* entry = ::readdir(hostDev.get())) {
      if (!IsLoopName(entry->d_name)) continue;
      struct stat host {};
      std::string hostPath = std::string("/dev/") + entry->d_name;
      if (::stat(hostPath.c_str(), &host) != 0 || !S_ISBLK(host.st_mode)) continue;
      if (!EnsureNode(dev->get(), entry->d_name, S_IFBLK, host.st_rdev, 0660,
                      devPath + "/" + entry->d_name, error)) {
        return false;
      }
    }
  }
  const std::pair<const char*, const char*> links[] = {
      {"fd", "/proc/self/fd"},
      {"stdin", "/proc/self/fd/0"},
      {"stdout", "/proc/self/fd/1"},
      {"stderr", "/proc/self/fd/2"},
  };
  for (const auto& [name, target] : links) {
    if (!EnsureLink(dev->get(), name, target, devPath + "/" + name, error)) return false;
  }
  return true;
}

unsigned long InheritedLockFlags(const char* hostPath) {
  struct statvfs vfs {};
  unsigned long flags = 0;
  if (::statvfs(hostPath, &vfs) != 0) return flags;
  if (vfs.f_flag & ST_NOSUID) flags |= MS_NOSUID;
  if (vfs.f_flag & ST_NODEV) flags |= MS_NODEV;
  if (vfs.f_flag & ST_NOEXEC) flags |= MS_NOEXEC;
  return flags;
}

// Binds the host's `hostPath` at root/name, private so that it propagates nowhere.
// A mount already there (from an earlier start) is reused when it shows the same file
// system, so restarts never stack binds.
bool BindHostTree(int rootFd, const std::string& root, const std::string& name,
                  const char* hostPath, bool readOnly, std::string* error) {
  std::string target = root + "/" + name;
  auto dir = EnsureDirectory(rootFd, name, 0755, target, error);
  if (!dir) return false;
  for (const os::MountRecord& mount : CurrentMounts()) {
    if (mount.mountedOn != target) continue;
    struct stat inside {}, host {};
    if (::fstat(dir->get(), &inside) == 0 && ::stat(hostPath, &host) == 0 && inside.st_dev == host.st_dev) {
      return true;
    }
    return Fail(error, target + " already has another file system (" + mount.typeName + ") mounted on it");
  }
  // Through the descriptor, so the mount lands on the directory that was checked.
  std::string viaFd = "/proc/self/fd/" + std::to_string(dir->get());
  if (::mount(hostPath, viaFd.c_str(), nullptr, MS_BIND, nullptr) != 0) {
    return Fail(error, SystemError(std::string("cannot bind ") + hostPath + " on " + target, errno));
  }
  if (::mount(nullptr, target.c_str(), nullptr, MS_PRIVATE, nullptr) != 0) {
    int err = errno;
    ::umount2(target.c_str(), MNT_DETACH);
    return Fail(error, SystemError("cannot make " + target + " private", err));
  }
  if (readOnly) {
    unsigned long flags = MS_BIND | MS_REMOUNT | MS_RDONLY | InheritedLockFlags(hostPath);
    if (::mount(nullptr, target.c_str(), nullptr, flags, nullptr) != 0) {
      int err = errno;
      ::umount2(target.c_str(), MNT_DETACH);
      return Fail(error, SystemError("cannot make " + target + " read-only", err));
    }
  }
  return true;
}

bool BuildTree(int rootFd, const std::string& root, std::string* error) {
  Fd marker(::openat(rootFd, kSandboxMarker, O_WRONLY | O_CREAT | O_NOFOLLOW | O_CLOEXEC, 0644));
  if (!marker) return Fail(error, SystemError("cannot write " + root + "/" + kSandboxMarker, errno));
  if (!BuildDeviceRoot(rootFd, root, error)) return false;
  if (!BindHostTree(rootFd, root, "proc", "/proc", false, error)) return false;
  if (!BindHostTree(rootFd, root, "sys", "/sys", false, error)) return false;
  if (!BindHostTree(rootFd, root, "usr", "/usr", true, error)) return false;
  for (const char* name : {"bin", "lib", "lib64"}) {
    if (!EnsureLink(rootFd, name, std::string("usr/") + name, root + "/" + name, error)) return false;
  }
  if (!EnsureDirectory(rootFd, "sbin", 0755, root + "/sbin", error)) return false;
  if (!EnsureDirectory(rootFd, "tmp", 01777, root + "/tmp", error)) return false;

  // /var is a link into /private, as on the device.
  auto priv = EnsureDirectory(rootFd, "private", 0755, root + "/private", error);
  if (!priv) return false;
  auto var = EnsureDirectory(priv->get(), "var", 0755, root + "/private/var", error);
  if (!var) return false;
  if (!EnsureLink(rootFd, "var", "private/var", root + "/var", error)) return false;
  std::string varPath = root + "/private/var";
  if (!EnsureDirectory(var->get(), "tmp", 01777, varPath + "/tmp", error)) return false;
  if (!EnsureDirectory(var->get(), "mnt", 0755, varPath + "/mnt", error)) return false;
  auto run = EnsureDirectory(var->get(), "run", 0755, varPath + "/run", error);
  if (!run) return false;
  return EnsureDirectory(run->get(), "vexa", 0755, varPath + "/run/vexa", error).has_value();
}

}  // namespace

bool EnterSandboxRoot(const std::string& dir, std::string* error) {
  auto resolved = ResolveSandboxDir(dir, false, error);
  if (!resolved) return false;
  const std::string& root = resolved->path;
  if (!HasCapabilities({CAP_SYS_ADMIN, CAP_MKNOD, CAP_SYS_CHROOT})) {
    return Fail(error, "entering the sandbox root " + root +
                           " needs root (CAP_SYS_ADMIN, CAP_MKNOD and CAP_SYS_CHROOT)");
  }
  {
    // Every descriptor into the tree is closed before the chroot: an open directory
    // outside the new root would be a way back out.
    Fd rootFd(::open(root.c_str(), O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC | O_RDONLY));
    if (!rootFd) return Fail(error, SystemError("cannot open " + root, errno));
    if (!BuildTree(rootFd.get(), root, error)) return false;
  }
  if (::chroot(root.c_str()) != 0) return Fail(error, SystemError("cannot chroot to " + root, errno));
  if (::chdir("/") != 0) return Fail(error, SystemError("cannot change to / in " + root, errno));
  return true;
}

bool CheckFilesystemLayout(std::string* error) {
  char buffer[PATH_MAX];
  if (!::realpath("/var", buffer)) return Fail(error, SystemError("cannot resolve /var", errno));
  if (std::string_view(buffer) != "/private/var") {
    return Fail(error, std::string("/var resolves to ") + buffer +
                           ", not /private/var: the mount roots would lie outside it "
                           "(use --root DIR to run in a sandbox root)");
  }
  return true;
}

}  // namespace brisvale::linux_os
