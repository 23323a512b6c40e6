// The operating system's calls the daemon's core makes, behind one interface so the
// core can be tested with a fake. The Linux implementation lives in
// platform/linux/os_*.cc, one file per group of calls.
//
// Calls that can fail answer 0 (or a count, or a descriptor) on success and -errno on
// failure, so the core logs the error number without reading errno.
#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <span>
#include <string>
#include <vector>

namespace brisvale::os {

// Paths and names the core hands to the system are copied into buffers of this size,
// terminator included.
inline constexpr size_t kPathBufferSize = 1024;

// Mount-table flags.
inline constexpr uint32_t kMountReadOnly = 0x1;
inline constexpr uint32_t kMountContentProtection = 0x80;  // never set on Linux

// One mounted file system.
struct MountRecord {
  uint32_t flags = 0;
  std::string typeName;     // "ext4", "tmpfs", "hfs" ...
  std::string mountedOn;    // the directory, escapes of the kernel's table decoded
  std::string mountedFrom;  // the source: a device path, or a name such as "tmpfs"
  bool operator==(const MountRecord&) const = default;
};

// The start of a medium that file-system identification looks at.
inline constexpr size_t kVolumeHeaderLength = 4096;
using VolumeHeaderSpan = std::span<uint8_t, kVolumeHeaderLength>;

// How reading a device node's volume header went. `error` is the error number current
// right after the failing call (a short read reports 0).
struct VolumeHeaderRead {
  enum class Outcome { Read, OpenFailed, ReadFailed };
  Outcome outcome = Outcome::Read;
  int error = 0;
};

// One entry of a directory, "." and ".." left out.
struct DirectoryEntry {
  std::string name;
  bool isDirectory = false;  // asked of the file system when the directory does not say
  bool isLink = false;       // a symbolic link, which is never a directory here
};

// A node of a tree walk (see WalkTree).
struct TreeNode {
  enum class Kind {
    NonDirectory,       // a file, a link (never followed), a FIFO, a device node ...
    DirectoryPreorder,  // a directory before its contents
    DirectoryPostorder, // a directory after its contents
    Other,              // unreadable, cannot be examined, a cycle
  };
  Kind kind = Kind::Other;
  std::string path;
  int level = 0;  // 0 for the start path
  // A directory below the start on which another file system is mounted: the walk
  // reports it before and after, never its contents.
  bool mountPoint = false;
};

// How a tree walk ended: 0 when it ran to the end or the visitor stopped it.
struct TreeWalk {
  int openError = 0;   // -errno when the walk could not start
  int closeError = 0;  // -errno when it could not be closed
};

class Os {
 public:
  virtual ~Os() = default;

  // The mount table, in table order, count first then fill: with no room it answers
  // how many file systems are mounted; with room it fills at most records.size()
  // records and answers how many it filled. -errno on failure.
  virtual int GetMountTable(std::span<MountRecord> records) = 0;

  // Opens `devicePath` read-only, fills `header` from offset 0 with one read of
  // kVolumeHeaderLength bytes and closes it on every path.
  virtual VolumeHeaderRead ReadVolumeHeader(const char* devicePath, VolumeHeaderSpan header) = 0;

  // Takes the file system mounted on `path` away. With `force` it goes even while
  // files on it are open.
  virtual int Unmount(const char* path, bool force) = 0;
  virtual int RemoveDirectory(const char* path) = 0;
  // Removes a non-directory; a link itself, never what it points to.
  virtual int Unlink(const char* path) = 0;
  // Flushes the file system mounted on `path`; returns once the data is on the device.
  virtual int SyncFilesystem(const char* path) = 0;

  // A read-only descriptor for a device node, owned by the caller, or -errno.
  virtual int OpenDevice(const char* devicePath) = 0;
  // Asks the device behind `fd` to go: a loop device lets go of its file, a removable
  // disk is ejected.
  virtual int EjectDevice(int fd) = 0;

  // The entries of `path` in directory order, or -errno when it cannot be opened
  // (`entries` then stays empty).
  virtual int ReadDirectory(const char* path, std::vector<DirectoryEntry>& entries) = 0;
  // The canonical path, or -errno.
  virtual int RealPath(const char* path, std::string& resolved) = 0;
  // Clears the immutable and append-only flags. Links have none; FIFOs and device
  // nodes are left unopened. 0 when there was nothing to clear.
  virtual int ClearFlags(const char* path) = 0;
  // Walks `root` (followed when it is a link) and everything below it, links not
  // followed, directories visited before and after their contents, never entering
  // another file system: a mount point inside the tree is visited but not descended
  // into. The visitor answers false to stop the walk.
  virtual TreeWalk WalkTree(const char* root, const std::function<bool(const TreeNode&)>& visit) = 0;

  // A read-only descriptor for a file's contents, owned by the caller, or -errno. The
  // file is expected to be read front to back.
  virtual int OpenFile(const char* path) = 0;
  // The size in bytes of the file behind `fd`, or -errno.
  virtual int64_t FileSize(int fd) = 0;
  // Reads at most buffer.size() bytes from the file position, retrying when a signal
  // interrupts: the count read (0 at the end of the file) or -errno.
  virtual int64_t Read(int fd, std::span<uint8_t> buffer) = 0;
};

// The operating system this process runs on.
Os& SystemOs();

// The whole mount table through GetMountTable's count-then-fill, with room for one more
// record than counted so that a mount made between the two calls still fits: the
// number of records (0 when nothing is mounted) or -errno.
inline int CopyMountTable(Os& os, std::vector<MountRecord>& records) {
  records.clear();
  const int counted = os.GetMountTable({});
  if (counted < 1) return counted;
  records.resize(static_cast<size_t>(counted) + 1);
  const int filled = os.GetMountTable(records);
  records.resize(filled < 0 ? 0 : std::min(records.size(), static_cast<size_t>(filled)));
  return filled;
}

}  // namespace brisvale::os
