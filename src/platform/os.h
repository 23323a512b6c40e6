// The operating system's calls the daemon's core makes, behind one interface so the
// core can be tested with a fake. The Linux implementation lives in
// platform/linux/os_*.cc, one file per group of calls.
//
// Calls that can fail answer 0 (or a count, or a descriptor) on success and -errno on
// failure, so the core logs the error number without reading errno.
#pragma once

#include <cerrno>
#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <span>
#include <string>
#include <string_view>
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

// A directory's entries in directory order. A read error ends the listing as its end
// does; a failure to close it leaves the entries good.
struct DirectoryListing {
  int openError = 0;   // -errno when the directory could not be opened (no entries)
  int closeError = 0;  // -errno when closing it failed
  std::vector<DirectoryEntry> entries;
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
  // The node's name in the directory that holds it, and that directory's handle, valid
  // only during the visit: the calls ending in At act on exactly this node.
  std::string name;
  int directory = -1;
};

// A regular file found by ReadFilesBelow, read in full. Valid during the visit only.
struct FoundFile {
  std::string_view relativePath;  // from the directory the walk started at
  std::span<const uint8_t> bytes;
};

// What lstat or fstat tells about a file.
struct FileStatus {
  uint32_t mode = 0;  // type bits (0xF000) and permissions
  uint64_t device = 0;
  uint64_t inode = 0;
  uint64_t linkCount = 0;
};
inline constexpr uint32_t kFileTypeMask = 0xF000;
inline constexpr uint32_t kFileTypeRegular = 0x8000;
inline constexpr uint32_t kFileTypeDirectory = 0x4000;

// How a tree walk ended: 0 when it ran to the end or the visitor stopped it.
struct TreeWalk {
  int openError = 0;   // -errno when the walk could not start
  int closeError = 0;  // -errno when it could not be closed
};

// The arguments of an image volume mount, as the platform's HFS mount takes them.
struct VolumeMountArguments {
  std::string devicePath;
  uint32_t ownerUid = 0;
  uint32_t ownerGid = 0;
  uint16_t permissionMask = 0777;
  uint32_t textEncoding = 0xFFFFFFFF;  // none chosen
};

// Mount flags of MountVolume.
inline constexpr uint32_t kMountUnion = 0x20;

// A read-only mapping of a file; unmapped when destroyed.
class FileMapping {
 public:
  virtual ~FileMapping() = default;
  virtual std::span<const uint8_t> Bytes() const = 0;
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
  // The number of the block device that holds the file system mounted on `path`, or
  // -ENODEV when none does (a memory or pseudo file system, whatever its source says).
  virtual int MountedDevice(const char* path, uint64_t& device) = 0;
  // The number of the block device open on `fd`, or -ENOTBLK.
  virtual int DeviceNumber(int fd, uint64_t& device) = 0;

  virtual DirectoryListing ReadDirectory(const char* path) = 0;
  // The canonical path, or -errno.
  virtual int RealPath(const char* path, std::string& resolved) = 0;
  // Clears the immutable and append-only flags. Links have none; FIFOs and device
  // nodes are left unopened. 0 when there was nothing to clear.
  virtual int ClearFlags(const char* path) = 0;
  // Walks `root` and everything below it, links not followed, directories visited
  // before and after their contents, never entering another mount: a mount point inside
  // the tree is visited but not descended into. A root reached through a link, or that
  // is one, is not walked (openError -ELOOP). The visitor answers false to stop.
  virtual TreeWalk WalkTree(const char* root, const std::function<bool(const TreeNode&)>& visit) = 0;
  // Reads every regular file at any depth below `directory`, hidden ones included, in
  // directory order, going into a subdirectory as soon as it is met. Never follows a
  // symbolic link (neither in `directory` itself nor below it), never leaves the file
  // system `directory` is on, never opens anything in a way that could block. Files
  // above `maxFileBytes` and everything that is not a regular file are passed over.
  // The visitor answers false to stop. 0, or -errno when `directory` cannot be opened.
  virtual int ReadFilesBelow(const char* /*directory*/, size_t /*maxFileBytes*/,
                             const std::function<bool(const FoundFile&)>& /*visit*/) {
    return -ENOSYS;
  }

  // The file at `path` itself, a link not followed.
  virtual int StatPath(const char* /*path*/, FileStatus& /*status*/) { return -ENOSYS; }
  virtual int StatDescriptor(int /*fd*/, FileStatus& /*status*/) { return -ENOSYS; }
  virtual int MakeDirectory(const char* /*path*/, uint32_t /*mode*/) { return -ENOSYS; }
  // Makes a new directory from `pathTemplate`, whose trailing "XXXXXX" characters are
  // replaced in place.
  virtual int MakeTemporaryDirectory(std::string& /*pathTemplate*/) { return -ENOSYS; }
  virtual int ChangeMode(const char* /*path*/, uint32_t /*mode*/) { return -ENOSYS; }
  // A read-only descriptor for the file at `path`, never through a link as its last
  // component, owned by the caller.
  virtual int OpenImageFile(const char* /*path*/) { return -ENOSYS; }
  // A read lease on `fd` (opened read-only): refused while anyone has the file open for
  // writing, and broken by anyone opening it for writing or truncating it later. It
  // lasts until the descriptor is closed.
  virtual int TakeReadLease(int /*fd*/) { return -ENOSYS; }
  // False once the lease on `fd` has been broken, or was never held.
  virtual bool HoldsReadLease(int /*fd*/) { return false; }

  // Starts the program at the absolute path argv[0] with `argv` and an empty
  // environment; the child inherits every descriptor. The child's process id, or -errno
  // when it could not be started (a missing program included).
  virtual int SpawnProgram(const std::vector<std::string>& /*argv*/) { return -ENOSYS; }
  // Blocks until child `pid` ends, however long that takes, and gives its raw wait
  // status (exit code in bits 8-15 when the low 7 bits are 0). 0 or -errno.
  virtual int WaitForChild(int /*pid*/, int& /*waitStatus*/) { return -ENOSYS; }

  // Mounts the volume on `arguments.devicePath` at `mountPoint` with the platform's
  // file-system `type` ("hfs") and flags (kMountReadOnly, kMountUnion).
  virtual int MountVolume(const char* type, const char* mountPoint, uint32_t flags,
                          const VolumeMountArguments& arguments) = 0;
  // The text-encoding bias the file system `type` was loaded with.
  virtual int EncodingBias(const char* type, int32_t& bias) = 0;
  // The home directory of user `uid` in the user database.
  virtual int UserHomeDirectory(uint32_t uid, std::string& home) = 0;
  // At most `maxLength` bytes from the start of the file at `path`.
  virtual int ReadFile(const char* path, size_t maxLength, std::vector<uint8_t>& contents) = 0;
  // A read-only descriptor for the file at `path`, owned by the caller, or -errno. The
  // file is expected to be read front to back.
  virtual int OpenFile(const char* path) = 0;
  virtual int FileSize(int fd, uint64_t& size) = 0;
  // Reads at most buffer.size() bytes at `offset`, retrying when a signal interrupts:
  // the count read (0 at the end of the file) or -errno.
  virtual int64_t Read(int fd, std::span<uint8_t> buffer, uint64_t offset) = 0;
  // Maps the first `length` bytes of `fd` read-only and private.
  virtual int MapFile(int fd, size_t length, std::unique_ptr<FileMapping>& mapping) = 0;

  // Unlink, RemoveDirectory and ClearFlags for `name` in the directory handle
  // `directory` of a TreeNode being visited.
  virtual int UnlinkAt(int directory, const char* name) = 0;
  virtual int RemoveDirectoryAt(int directory, const char* name) = 0;
  virtual int ClearFlagsAt(int directory, const char* name) = 0;
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
