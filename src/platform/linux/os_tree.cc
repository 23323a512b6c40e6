// Directory reading and the tree walk of the start-up clean-up, with flag clearing.
#include <dirent.h>
#include <fcntl.h>
#include <fts.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <memory>

#include "base/unique_fd.h"
#include "platform/linux/os_system.h"

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

TreeNode::Kind KindOf(const FTSENT& entry) {
  switch (entry.fts_info) {
    case FTS_D:
      return TreeNode::Kind::DirectoryPreorder;
    case FTS_DP:
      return TreeNode::Kind::DirectoryPostorder;
    case FTS_F:
    case FTS_SL:
    case FTS_SLNONE:
    case FTS_DEFAULT:
      return TreeNode::Kind::NonDirectory;
    default:  // FTS_DC, FTS_DNR, FTS_ERR, FTS_NS, FTS_NSOK, FTS_DOT
      return TreeNode::Kind::Other;
  }
}

}  // namespace

int LinuxOs::ReadDirectory(const char* path, std::vector<DirectoryEntry>& entries) {
  entries.clear();
  std::unique_ptr<DIR, DirCloser> dir(::opendir(path));
  if (!dir) return -errno;
  const int dirFd = ::dirfd(dir.get());
  errno = 0;
  while (const dirent* entry = ::readdir(dir.get())) {
    const std::string_view name = entry->d_name;
    if (name == "." || name == "..") continue;
    const unsigned char type = entry->d_type == DT_UNKNOWN ? TypeAt(dirFd, entry->d_name) : entry->d_type;
    entries.push_back({std::string(name), type == DT_DIR, type == DT_LNK});
    errno = 0;
  }
  if (errno != 0) return -errno;
  if (::closedir(dir.release()) != 0) return -errno;
  return 0;
}

int LinuxOs::RealPath(const char* path, std::string& resolved) {
  char buffer[PATH_MAX];
  if (!::realpath(path, buffer)) return -errno;
  resolved = buffer;
  return 0;
}

int LinuxOs::ClearFlags(const char* path) {
  struct stat status {};
  if (::lstat(path, &status) != 0) return -errno;
  // Only regular files and directories carry the flags and can be opened without side
  // effects: opening a FIFO or a device node could block or wake hardware.
  if (!S_ISREG(status.st_mode) && !S_ISDIR(status.st_mode)) return 0;
  const UniqueFd fd(::open(path, O_RDONLY | O_NONBLOCK | O_NOFOLLOW | O_CLOEXEC));
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

TreeWalk LinuxOs::WalkTree(const char* root, const std::function<bool(const TreeNode&)>& visit) {
  TreeWalk result;
  char* paths[] = {const_cast<char*>(root), nullptr};
  // Physical walk (links are nodes, not followed) with the start path followed when it
  // is a link, and never into another file system: a mount point inside the tree is
  // reported as a directory without its contents.
  FTS* walk = ::fts_open(paths, FTS_PHYSICAL | FTS_COMFOLLOW | FTS_XDEV | FTS_NOCHDIR, nullptr);
  if (!walk) {
    result.openError = -errno;
    return result;
  }
  dev_t startDevice = 0;
  while (const FTSENT* entry = ::fts_read(walk)) {
    TreeNode node{KindOf(*entry), std::string(entry->fts_path, entry->fts_pathlen),
                  static_cast<int>(entry->fts_level)};
    const bool directory = entry->fts_info == FTS_D || entry->fts_info == FTS_DP;
    if (entry->fts_level == FTS_ROOTLEVEL) {
      if (directory) startDevice = entry->fts_statp->st_dev;
    } else if (directory) {
      node.mountPoint = entry->fts_statp->st_dev != startDevice;
    }
    if (!visit(node)) break;
  }
  if (::fts_close(walk) != 0) result.closeError = -errno;
  return result;
}

}  // namespace brisvale::os
