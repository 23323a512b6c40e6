// Directory reading, flag clearing and removal relative to a directory, and the tree
// walk over the real file system.
#include <dirent.h>
#include <fcntl.h>
#include <linux/fs.h>
#include <linux/openat2.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <memory>
#include <string>
#include <string_view>

#include "base/unique_fd.h"
#include "platform/linux/os_system.h"
#include "platform/linux/os_tree_walk.h"

namespace brisvale::os {
namespace {

struct DirCloser {
  void operator()(DIR* dir) const { ::closedir(dir); }
};

// The entry's type from the file system itself, for directories that do not report it.
unsigned char TypeAt(int dirFd, const char* name) {
  struct stat status {};
  if (::fstatat(dirFd, name, &status, AT_SYMLINK_NOFOLLOW) != 0) return DT_UNKNOWN;
  if (S_ISDIR(status.st_mode)) return DT_DIR;
  return S_ISLNK(status.st_mode) ? DT_LNK : DT_REG;
}

// One component at a time, each opened O_NOFOLLOW relative to the one before, so a
// link anywhere on the way is refused just as the single call refuses it.
int OpenByComponents(const char* path) {
  UniqueFd dir(::open(path[0] == '/' ? "/" : ".", O_PATH | O_DIRECTORY | O_CLOEXEC));
  if (!dir) return -errno;
  std::string_view rest = path;
  while (!rest.empty()) {
    const size_t slash = rest.find('/');
    const std::string component(rest.substr(0, slash));
    rest = slash == std::string_view::npos ? std::string_view() : rest.substr(slash + 1);
    if (component.empty()) continue;
    UniqueFd next(::openat(dir.get(), component.c_str(), O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!next) {
      // A link fails here as "not a directory"; the single call says so only for the
      // last component and "too many links" for one on the way.
      const int error = errno;
      if (rest.find_first_not_of('/') == std::string_view::npos) return -error;
      struct stat status {};
      const bool link = ::fstatat(dir.get(), component.c_str(), &status, AT_SYMLINK_NOFOLLOW) == 0 &&
                        S_ISLNK(status.st_mode);
      return link ? -ELOOP : -error;
    }
    dir = std::move(next);
  }
  const int fd = ::openat(dir.get(), ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  return fd >= 0 ? fd : -errno;
}

// Directories by descriptor, for the tree walk.
class LinuxDirectories final : public DirectoryAccess {
 public:
  int OpenPath(const char* path) override { return OpenDirectoryNoLinks(path); }
  int OpenChild(int dir, const char* name) override {
    const int fd = ::openat(dir, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    return fd >= 0 ? fd : -errno;
  }
  int OpenParent(int dir) override { return OpenChild(dir, ".."); }
  void Close(int handle) override { ::close(handle); }
  int IdentityOf(int dir, Identity& identity) override {
    struct statx status {};
    if (::statx(dir, "", AT_EMPTY_PATH, STATX_INO | STATX_MNT_ID, &status) != 0) return -errno;
    identity.device = makedev(status.stx_dev_major, status.stx_dev_minor);
    identity.inode = status.stx_ino;
    identity.mountId = (status.stx_mask & STATX_MNT_ID) ? status.stx_mnt_id : 0;
    identity.mountRoot = (status.stx_attributes_mask & STATX_ATTR_MOUNT_ROOT) &&
                         (status.stx_attributes & STATX_ATTR_MOUNT_ROOT);
    return 0;
  }
  int List(int dir, std::vector<std::string>& names) override {
    names.clear();
    // Read straight from the walk's own descriptor, fresh from its open, rather than
    // through a second one: every extra descriptor is one more close per directory.
    alignas(dirent64) char buffer[32768];
    for (;;) {
      const ssize_t length = ::getdents64(dir, buffer, sizeof buffer);
      if (length < 0) return -errno;
      if (length == 0) return 0;
      for (ssize_t offset = 0; offset < length;) {
        const auto* entry = reinterpret_cast<const dirent64*>(buffer + offset);
        const std::string_view name = entry->d_name;
        if (name != "." && name != "..") names.emplace_back(name);
        offset += entry->d_reclen;
      }
    }
  }
  int TypeOf(int dir, const char* name) override {
    struct stat status {};
    if (::fstatat(dir, name, &status, AT_SYMLINK_NOFOLLOW) != 0) return -errno;
    if (S_ISDIR(status.st_mode)) return kDirectory;
    return S_ISLNK(status.st_mode) ? kLink : kOther;
  }
};

int Status(int rc) { return rc == 0 ? 0 : -errno; }

}  // namespace

int OpenDirectoryNoLinks(const char* path, bool byComponents) {
  if (!byComponents) {
    open_how how{};
    how.flags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
    how.resolve = RESOLVE_NO_SYMLINKS;
    const long fd = ::syscall(SYS_openat2, AT_FDCWD, path, &how, sizeof how);
    if (fd >= 0) return static_cast<int>(fd);
    // Kernels before 5.6 lack the call, and a seccomp filter that cannot look inside
    // its argument structure (the service unit's RestrictSUIDSGID=) answers ENOSYS.
    if (errno != ENOSYS) return -errno;
  }
  return OpenByComponents(path);
}

DirectoryListing LinuxOs::ReadDirectory(const char* path) {
  DirectoryListing listing;
  std::unique_ptr<DIR, DirCloser> dir(::opendir(path));
  if (!dir) {
    listing.openError = -errno;
    return listing;
  }
  const int dirFd = ::dirfd(dir.get());
  errno = 0;
  while (const dirent* entry = ::readdir(dir.get())) {
    const std::string_view name = entry->d_name;
    if (name == "." || name == "..") continue;
    const unsigned char type = entry->d_type == DT_UNKNOWN ? TypeAt(dirFd, entry->d_name) : entry->d_type;
    listing.entries.push_back({std::string(name), type == DT_DIR, type == DT_LNK});
    errno = 0;
  }
  // A read error ends the listing as its end does: the entries read so far are served,
  // and the error is no failure to open or to close.
  if (::closedir(dir.release()) != 0) listing.closeError = -errno;
  return listing;
}

int LinuxOs::RealPath(const char* path, std::string& resolved) {
  char buffer[PATH_MAX];
  if (!::realpath(path, buffer)) return -errno;
  resolved = buffer;
  return 0;
}

int LinuxOs::ClearFlags(const char* path) { return ClearFlagsAt(AT_FDCWD, path); }

int LinuxOs::ClearFlagsAt(int directory, const char* name) {
  struct statx status {};
  if (::statx(directory, name, AT_SYMLINK_NOFOLLOW, STATX_TYPE, &status) != 0) return -errno;
  // Only regular files and directories carry the flags and can be opened without side
  // effects: opening a FIFO or a device node could block or wake hardware.
  if (!S_ISREG(status.stx_mode) && !S_ISDIR(status.stx_mode)) return 0;
  // Where the file system reports both flags as clear, nothing needs opening.
  constexpr uint64_t kFlags = STATX_ATTR_IMMUTABLE | STATX_ATTR_APPEND;
  if ((status.stx_attributes_mask & kFlags) == kFlags && (status.stx_attributes & kFlags) == 0) return 0;
  const UniqueFd fd(::openat(directory, name, O_RDONLY | O_NONBLOCK | O_NOFOLLOW | O_CLOEXEC));
  if (!fd) return -errno;
  int flags = 0;
  if (::ioctl(fd.get(), FS_IOC_GETFLAGS, &flags) != 0) {
    // File systems without attribute flags have nothing to clear.
    return errno == ENOTTY || errno == EOPNOTSUPP ? 0 : -errno;
  }
  const int kept = flags & ~(FS_IMMUTABLE_FL | FS_APPEND_FL);
  if (kept == flags) return 0;
  return ::ioctl(fd.get(), FS_IOC_SETFLAGS, &kept) == 0 ? 0 : -errno;
}

int LinuxOs::UnlinkAt(int directory, const char* name) { return Status(::unlinkat(directory, name, 0)); }

int LinuxOs::RemoveDirectoryAt(int directory, const char* name) {
  return Status(::unlinkat(directory, name, AT_REMOVEDIR));
}

TreeWalk LinuxOs::WalkTree(const char* root, const std::function<bool(const TreeNode&)>& visit) {
  return WalkDirectoryTree(root, visit);
}

TreeWalk WalkDirectoryTree(const char* root, const std::function<bool(const TreeNode&)>& visit) {
  LinuxDirectories directories;
  return WalkTreeWith(directories, root, visit);
}

}  // namespace brisvale::os
