// ReadFilesBelow: reads the files of a directory tree that came from an untrusted
// volume. Everything is opened relative to an already open directory with O_NOFOLLOW,
// so no link is ever followed; files are opened O_NONBLOCK and only regular ones are
// read, so a FIFO or device node cannot stall the caller; depth, entry count and file
// size are bounded, so a hostile tree costs bounded memory and time.
#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "base/unique_fd.h"
#include "platform/linux/os_system.h"

namespace brisvale::os {
namespace {

constexpr size_t kMaxDepth = 64;         // directories below the start
constexpr size_t kMaxEntries = 1 << 17;  // entries looked at in one walk

struct DirCloser {
  void operator()(DIR* dir) const { ::closedir(dir); }
};
using UniqueDir = std::unique_ptr<DIR, DirCloser>;

struct OpenDirectory {
  UniqueDir dir;
  std::string prefix;  // relative path of this directory, "" or ending in "/"
};

// The kind of `name`, asked of the file system only when the directory does not say.
unsigned char EntryType(int dirFd, const dirent& entry) {
  if (entry.d_type != DT_UNKNOWN) return entry.d_type;
  struct stat st;
  if (::fstatat(dirFd, entry.d_name, &st, AT_SYMLINK_NOFOLLOW) != 0) return DT_UNKNOWN;
  if (S_ISDIR(st.st_mode)) return DT_DIR;
  if (S_ISREG(st.st_mode)) return DT_REG;
  return DT_UNKNOWN;
}

// Reads the regular file `name` in full into `bytes`; false for anything else, for a
// file above `maxBytes`, or when reading fails.
bool ReadRegularFile(int dirFd, const char* name, size_t maxBytes, std::vector<uint8_t>& bytes) {
  UniqueFd fd(::openat(dirFd, name, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
  struct stat st;
  if (!fd || ::fstat(fd.get(), &st) != 0 || !S_ISREG(st.st_mode)) return false;
  if (st.st_size < 0 || static_cast<size_t>(st.st_size) > maxBytes) return false;
  // One byte of room beyond the size seen, so a file that grew meanwhile is noticed.
  bytes.resize(static_cast<size_t>(st.st_size) + 1);
  size_t filled = 0;
  while (filled < bytes.size()) {
    const ssize_t got = ::read(fd.get(), bytes.data() + filled, bytes.size() - filled);
    if (got < 0 && errno == EINTR) continue;
    if (got < 0) return false;
    if (got == 0) break;
    filled += static_cast<size_t>(got);
  }
  if (filled > static_cast<size_t>(st.st_size)) return false;
  bytes.resize(filled);
  return true;
}

// The subdirectory `name` when it lies on `device`; a mount point below is not entered.
UniqueDir OpenSubdirectory(int dirFd, const char* name, dev_t device) {
  UniqueFd fd(::openat(dirFd, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  struct stat st;
  if (!fd || ::fstat(fd.get(), &st) != 0 || st.st_dev != device) return nullptr;
  UniqueDir dir(::fdopendir(fd.get()));
  if (dir) fd.release();
  return dir;
}

}  // namespace

int LinuxOs::ReadFilesBelow(const char* directory, size_t maxFileBytes,
                            const std::function<bool(const FoundFile&)>& visit) {
  // The start directory, refusing a link anywhere on the way.
  const int startFd = OpenDirectoryNoLinks(directory);
  if (startFd < 0) return startFd;
  UniqueFd start(startFd);
  struct stat st;
  if (::fstat(start.get(), &st) != 0) return -errno;
  const dev_t device = st.st_dev;
  UniqueDir startDir(::fdopendir(start.get()));
  if (!startDir) return -errno;
  start.release();

  std::vector<OpenDirectory> stack;
  stack.push_back({std::move(startDir), ""});
  std::vector<uint8_t> bytes;
  size_t entries = 0;
  while (!stack.empty()) {
    OpenDirectory& level = stack.back();
    const dirent* entry = ::readdir(level.dir.get());
    if (!entry) {
      stack.pop_back();
      continue;
    }
    if (std::strcmp(entry->d_name, ".") == 0 || std::strcmp(entry->d_name, "..") == 0) continue;
    if (++entries > kMaxEntries) return 0;
    const int dirFd = ::dirfd(level.dir.get());
    const unsigned char type = EntryType(dirFd, *entry);
    if (type == DT_DIR) {
      if (stack.size() > kMaxDepth) continue;
      UniqueDir sub = OpenSubdirectory(dirFd, entry->d_name, device);
      // `level` dies with the push below; take the prefix first.
      std::string prefix = level.prefix + entry->d_name + "/";
      if (sub) stack.push_back({std::move(sub), std::move(prefix)});
    } else if (type == DT_REG && ReadRegularFile(dirFd, entry->d_name, maxFileBytes, bytes)) {
      const std::string relativePath = level.prefix + entry->d_name;
      if (!visit(FoundFile{relativePath, bytes})) return 0;
    }
  }
  return 0;
}

}  // namespace brisvale::os
