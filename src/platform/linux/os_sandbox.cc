#include "platform/linux/os_sandbox.h"
#include "base/unique_fd.h"

#include <dirent.h>
#include <fcntl.h>
#include <linux/capability.h>
#include <linux/loop.h>
#include <sys/ioctl.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <sys/syscall.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <memory>
#include <optional>
#include <sstream>
#include <string_view>
#include <utility>
#include <vector>

namespace brisvale::linux_os {
namespace {

using Fd = UniqueFd;

struct DirCloser {
  void operator()(DIR* dir) const { ::closedir(dir); }
};
using DirHandle = std::unique_ptr<DIR, DirCloser>;

bool Fail(std::string* error, std::string message) {
  if (error) *error = std::move(message);
  return false;
}

std::string SystemError(const std::string& what, int err) {
  return what + ": " + std::strerror(err);
}

bool IsAtOrBelow(std::string_view path, std::string_view dir) {
  return path == dir || (path.size() > dir.size() && path.starts_with(dir) && path[dir.size()] == '/');
}

// ---------------------------------------------------------------------------------
// The mount table

struct MountRecord {
  std::string mountPoint;
  std::string fsType;
};

// mountinfo writes space, tab, newline and backslash in paths as \ooo.
std::string UnescapeMountPath(std::string_view text) {
  auto octal = [](char c) { return c >= '0' && c <= '7'; };
  std::string out;
  for (size_t i = 0; i < text.size(); ++i) {
    if (text[i] == '\\' && i + 3 < text.size() && octal(text[i + 1]) && octal(text[i + 2]) &&
        octal(text[i + 3])) {
      out += static_cast<char>((text[i + 1] - '0') * 64 + (text[i + 2] - '0') * 8 + (text[i + 3] - '0'));
      i += 3;
      continue;
    }
    out += text[i];
  }
  return out;
}

// In mount order, as the kernel lists them.
std::vector<MountRecord> ReadMountTable() {
  std::vector<MountRecord> mounts;
  std::ifstream in("/proc/self/mountinfo");
  std::string line;
  while (std::getline(in, line)) {
    // id parent major:minor root mount-point options [optional...] - type source super
    std::istringstream fields(line);
    std::string id, parent, device, root, mountPoint, field;
    if (!(fields >> id >> parent >> device >> root >> mountPoint)) continue;
    while (fields >> field && field != "-") {
    }
    MountRecord record;
    record.mountPoint = UnescapeMountPath(mountPoint);
    fields >> record.fsType;
    mounts.push_back(std::move(record));
  }
  return mounts;
}

// ---------------------------------------------------------------------------------
// Privileges

bool HasCapabilities(std::initializer_list<int> capabilities) {
  __user_cap_header_struct header{};
  header.version = _LINUX_CAPABILITY_VERSION_3;
  __user_cap_data_struct data[_LINUX_CAPABILITY_U32S_3]{};
  if (::syscall(SYS_capget, &header, data) != 0) return false;
  for (int cap : capabilities) {
    if (!(data[cap / 32].effective & (1u << (cap % 32)))) return false;
  }
  return true;
}

// ---------------------------------------------------------------------------------
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

bool IsLoopName(std::string_view name) {
  if (!name.starts_with("loop") || name.size() == 4) return false;
  return std::all_of(name.begin() + 4, name.end(), [](char c) { return c >= '0' && c <= '9'; });
}

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
  for (const MountRecord& mount : ReadMountTable()) {
    if (mount.mountPoint != target) continue;
    struct stat inside {}, host {};
    if (::fstat(dir->get(), &inside) == 0 && ::stat(hostPath, &host) == 0 && inside.st_dev == host.st_dev) {
      return true;
    }
    return Fail(error, target + " already has another file system (" + mount.fsType + ") mounted on it");
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

struct ResolvedDir {
  std::string path;
  bool exists = false;
};

// The absolute, link-free form of a sandbox directory, refusing "/" and non-directories.
std::optional<ResolvedDir> ResolveSandboxDir(const std::string& dir, bool missingIsFine,
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

// ---------------------------------------------------------------------------------
// Teardown

size_t Depth(const std::string& path) { return static_cast<size_t>(std::count(path.begin(), path.end(), '/')); }

bool UnmountAllBelow(const std::string& root, std::string* error) {
  // Rounds, because a mount hidden under another only shows up once that one is gone.
  for (int round = 0; round < 64; ++round) {
    std::vector<std::pair<size_t, std::string>> below;  // (order in table, mount point)
    std::vector<MountRecord> table = ReadMountTable();
    for (size_t i = 0; i < table.size(); ++i) {
      if (IsAtOrBelow(table[i].mountPoint, root)) below.emplace_back(i, table[i].mountPoint);
    }
    if (below.empty()) return true;
    // Deepest first; on one path the latest mount first.
    std::sort(below.begin(), below.end(), [](const auto& a, const auto& b) {
      size_t da = Depth(a.second), db = Depth(b.second);
      return da != db ? da > db : a.first > b.first;
    });
    for (const auto& [order, path] : below) {
      if (::umount2(path.c_str(), UMOUNT_NOFOLLOW) == 0) continue;
      if (errno == EINVAL || errno == ENOENT) continue;  // already gone with its parent
      if (::umount2(path.c_str(), UMOUNT_NOFOLLOW | MNT_DETACH) != 0 && errno != EINVAL) {
        return Fail(error, SystemError("cannot unmount " + path, errno));
      }
    }
  }
  return Fail(error, "mounts below " + root + " keep coming back");
}

std::optional<std::string> ReadFirstLine(const std::string& path) {
  std::ifstream in(path);
  std::string line;
  if (!in || !std::getline(in, line)) return std::nullopt;
  return line;
}

// Loop devices whose backing file lies in root. A busy one (still mounted) is only
// marked to detach itself when its last user goes, which the unmounts then bring about.
bool DetachLoopsBackedBelow(const std::string& root, std::string* error) {
  DirHandle blocks(::opendir("/sys/block"));
  if (!blocks) return true;
  bool ok = true;
  while (dirent* entry = ::readdir(blocks.get())) {
    std::string name = entry->d_name;
    if (!IsLoopName(name)) continue;
    auto backing = ReadFirstLine("/sys/block/" + name + "/loop/backing_file");
    if (!backing) continue;
    constexpr std::string_view kDeleted = " (deleted)";
    if (backing->ends_with(kDeleted)) backing->resize(backing->size() - kDeleted.size());
    if (!IsAtOrBelow(*backing, root)) continue;
    Fd device(::open(("/dev/" + name).c_str(), O_RDONLY | O_CLOEXEC));
    if (!device) device = Fd(::open((root + "/dev/" + name).c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
    if (!device || (::ioctl(device.get(), LOOP_CLR_FD, 0) != 0 && errno != ENXIO)) {
      ok = Fail(error, SystemError("cannot detach /dev/" + name + " (backed by " + *backing + ")", errno));
    }
  }
  return ok;
}

struct RemovalState {
  dev_t device;
  std::string firstError;
  int failures = 0;
  void Note(std::string message) {
    if (failures++ == 0) firstError = std::move(message);
  }
};

constexpr int kMaxTreeDepth = 512;

void RemoveContents(int dirFd, const std::string& path, int depth, RemovalState& state) {
  if (depth > kMaxTreeDepth) {
    state.Note(path + " is nested too deeply to remove");
    return;
  }
  std::vector<std::string> names;
  {
    Fd copy(::fcntl(dirFd, F_DUPFD_CLOEXEC, 0));
    DirHandle dir(copy ? ::fdopendir(copy.get()) : nullptr);
    if (!dir) {
      state.Note(SystemError("cannot read " + path, errno));
      return;
    }
    copy.release();  // the stream owns it now
    while (dirent* entry = ::readdir(dir.get())) {
      std::string_view name = entry->d_name;
      if (name != "." && name != "..") names.emplace_back(name);
    }
  }
  for (const std::string& name : names) {
    std::string childPath = path + "/" + name;
    struct statx stx {};
    if (::statx(dirFd, name.c_str(), AT_SYMLINK_NOFOLLOW, STATX_TYPE, &stx) != 0) {
      state.Note(SystemError("cannot inspect " + childPath, errno));
      continue;
    }
    if (!S_ISDIR(stx.stx_mode)) {
      if (::unlinkat(dirFd, name.c_str(), 0) != 0) state.Note(SystemError("cannot remove " + childPath, errno));
      continue;
    }
    bool mountRoot = (stx.stx_attributes_mask & STATX_ATTR_MOUNT_ROOT) &&
                     (stx.stx_attributes & STATX_ATTR_MOUNT_ROOT);
    if (mountRoot || makedev(stx.stx_dev_major, stx.stx_dev_minor) != state.device) {
      state.Note(childPath + " is a mount point; left in place");
      continue;
    }
    Fd child(::openat(dirFd, name.c_str(), O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC | O_RDONLY));
    if (!child) {
      state.Note(SystemError("cannot open " + childPath, errno));
      continue;
    }
    RemoveContents(child.get(), childPath, depth + 1, state);
    if (::unlinkat(dirFd, name.c_str(), AT_REMOVEDIR) != 0) {
      state.Note(SystemError("cannot remove " + childPath, errno));
    }
  }
}

bool RemoveTree(const std::string& root, std::string* error) {
  size_t slash = root.rfind('/');
  std::string parentPath = slash == 0 ? "/" : root.substr(0, slash);
  std::string name = root.substr(slash + 1);
  Fd parent(::open(parentPath.c_str(), O_DIRECTORY | O_CLOEXEC | O_RDONLY));
  if (!parent) return Fail(error, SystemError("cannot open " + parentPath, errno));
  Fd dir(::openat(parent.get(), name.c_str(), O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC | O_RDONLY));
  if (!dir) return Fail(error, SystemError("cannot open " + root, errno));
  struct stat st {};
  if (::fstat(dir.get(), &st) != 0) return Fail(error, SystemError("cannot inspect " + root, errno));
  RemovalState state{st.st_dev, {}, 0};
  RemoveContents(dir.get(), root, 0, state);
  if (state.failures == 0 && ::unlinkat(parent.get(), name.c_str(), AT_REMOVEDIR) != 0) {
    state.Note(SystemError("cannot remove " + root, errno));
  }
  if (state.failures == 0) return true;
  std::string message = state.firstError;
  if (state.failures > 1) message += " (and " + std::to_string(state.failures - 1) + " more)";
  return Fail(error, message);
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

bool TeardownSandboxRoot(const std::string& dir, std::string* error) {
  auto resolved = ResolveSandboxDir(dir, true, error);
  if (!resolved) return false;
  if (!resolved->exists) return true;
  const std::string& root = resolved->path;
  if (!HasCapabilities({CAP_SYS_ADMIN})) {
    return Fail(error, "tearing down the sandbox root " + root + " needs root (CAP_SYS_ADMIN)");
  }
  std::string marker = root + "/" + kSandboxMarker;
  struct stat st {};
  if (::lstat(marker.c_str(), &st) != 0 || !S_ISREG(st.st_mode)) {
    return Fail(error, root + " is not a sandbox root (it has no " + kSandboxMarker + "); left alone");
  }
  // Loops first, while their backing paths can still be read; busy ones detach
  // themselves as the unmounts release them.
  std::string loopError;
  bool loopsOk = DetachLoopsBackedBelow(root, &loopError);
  if (!UnmountAllBelow(root, error)) return false;
  if (!loopsOk && !DetachLoopsBackedBelow(root, error)) return false;
  return RemoveTree(root, error);
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
